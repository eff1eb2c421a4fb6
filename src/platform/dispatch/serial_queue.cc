// Serial queues on a shared worker pool. A queue is "scheduled" while it sits in the pool's
// ready list or a worker (or an inline sync caller, or the thread that claimed it) drains it; only
// then may its jobs run, so they run one at a time. A worker that blocks inside a job keeps its
// thread: the pool starts another for other queues, up to its cap (past a few eager workers, only
// once the ready queues have waited a moment with no worker coming free), and idle workers leave
// after a while.
//
// A queue that a sync() caller waits on never depends on a free worker: it goes to the front of
// the line and, when no worker is idle, gets a new one even past the cap. Without that, callers
// blocked in sync() could hold every worker while the queue they wait for sits in the ready list
// for good. The extra threads are bounded by the number of queues being waited on, and leave
// when idle like the others. (Waiters do not run the queue's jobs themselves: a job must not see
// the waiter's thread state, such as its current connection.)
#include "platform/dispatch/serial_queue.h"

#include <algorithm>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/dispatch/semaphore.h"

namespace typhora {

struct SerialQueue::State {
  std::string label;
  Clock* clock = nullptr;
  bool manual = false;
  SerialQueue* owner = nullptr;  // for current(); cleared when the queue object goes
  std::mutex mutex;
  std::condition_variable jobsReady;  // manual queues: wakes run()
  std::deque<Job> jobs;
  bool scheduled = false;
  std::size_t waiters = 0;  // sync() callers blocked until a job of theirs has run
};

namespace {

using StatePtr = std::shared_ptr<SerialQueue::State>;

// The queues whose jobs the calling thread runs, innermost last (sync chains nest).
thread_local std::vector<SerialQueue::State*> runningStack;

class RunningScope {
 public:
  explicit RunningScope(SerialQueue::State* state) { runningStack.push_back(state); }
  ~RunningScope() { runningStack.pop_back(); }
  RunningScope(const RunningScope&) = delete;
  RunningScope& operator=(const RunningScope&) = delete;
};

bool isRunning(const SerialQueue::State* state) {
  return std::find(runningStack.begin(), runningStack.end(), state) != runningStack.end();
}

constexpr int kJobsPerTurn = 32;  // then the queue goes to the back of the pool's line

void drainTurn(const std::shared_ptr<SerialQueue::State>& state);

class WorkerPool {
 public:
  static WorkerPool& shared() {
    static WorkerPool* pool = new WorkerPool();  // lives as long as the process
    return *pool;
  }

  // `waitedOn`: a sync() caller blocks on the queue, so it goes first and gets a worker whatever
  // the cap.
  void submit(StatePtr state, bool waitedOn) {
    std::lock_guard lock(mutex_);
    if (waitedOn) {
      ready_.push_front(std::move(state));
      wakeOrStartLocked(SIZE_MAX);
    } else {
      ready_.push_back(std::move(state));
      wakeOrGrowLocked();
    }
  }

  // A sync() caller now blocks on `state`: if it waits in the ready list, it moves to the front
  // and gets a worker whatever the cap. (A queue being drained is resubmitted the same way.)
  void expedite(const StatePtr& state) {
    std::lock_guard lock(mutex_);
    auto it = std::find(ready_.begin(), ready_.end(), state);
    if (it == ready_.end()) return;  // a worker took it meanwhile
    ready_.erase(it);
    ready_.push_front(state);
    wakeOrStartLocked(SIZE_MAX);
  }

  void setLimit(std::size_t limit) {
    std::lock_guard lock(mutex_);
    limit_ = std::max<std::size_t>(1, limit);
  }

  std::size_t threads() {
    std::lock_guard lock(mutex_);
    return threads_;
  }

 private:
  static constexpr auto kIdleExit = std::chrono::seconds(5);
  // Past the eager workers, a queue that finds no idle worker gets a new one only when the ready
  // list has not moved for this long: a burst of short jobs (a font change reaching hundreds of
  // connections) is served by the workers there are, not by a thread per queue, while queues
  // behind workers blocked in their jobs still get workers of their own soon.
  static constexpr auto kGrowAfter = std::chrono::milliseconds(1);

  static std::size_t eagerWorkers() {
    static const std::size_t eager = std::max(2u, std::thread::hardware_concurrency());
    return eager;
  }

  // Async work: an idle worker, else a new one while there are fewer than the eager workers,
  // else the grower adds one if the ready list stalls.
  void wakeOrGrowLocked() {
    if (idle_ >= ready_.size() || threads_ < std::min(limit_, eagerWorkers())) {
      wakeOrStartLocked(limit_);
      return;
    }
    if (threads_ >= limit_) return;
    if (!growerStarted_) {
      growerStarted_ = true;
      std::thread([this] { growerLoop(); }).detach();  // lives as long as the pool
    }
    grow_.notify_one();
  }

  bool stalledLocked() const { return idle_ < ready_.size() && threads_ < limit_; }

  void growerLoop() {
    std::unique_lock lock(mutex_);
    for (;;) {
      grow_.wait(lock, [this] { return stalledLocked(); });
      const std::uint64_t takenBefore = taken_;
      const auto deadline = std::chrono::steady_clock::now() + kGrowAfter;
      while (grow_.wait_until(lock, deadline) != std::cv_status::timeout) {
      }
      if (stalledLocked() && taken_ == takenBefore) {
        ++threads_;
        std::thread([this] { workerLoop(); }).detach();
      }
    }
  }

  void wakeOrStartLocked(std::size_t cap) {
    // A woken worker stays counted as idle until it runs, so compare against all ready queues:
    // each needs an idle worker of its own, or a new one.
    if (idle_ >= ready_.size()) {
      wake_.notify_one();
    } else if (threads_ < cap) {
      ++threads_;
      std::thread([this] { workerLoop(); }).detach();
    }
  }

  void workerLoop() {
    std::unique_lock lock(mutex_);
    for (;;) {
      ++idle_;
      bool woke = wake_.wait_for(lock, kIdleExit, [this] { return !ready_.empty(); });
      --idle_;
      if (!woke) {
        --threads_;
        return;
      }
      StatePtr state = std::move(ready_.front());
      ready_.pop_front();
      ++taken_;
      lock.unlock();
      drainTurn(state);
      lock.lock();
    }
  }

  std::mutex mutex_;
  std::condition_variable wake_;
  std::condition_variable grow_;
  std::deque<StatePtr> ready_;
  std::size_t threads_ = 0;
  std::size_t idle_ = 0;
  std::size_t limit_ = 64;
  std::uint64_t taken_ = 0;  // queues taken from the ready list so far
  bool growerStarted_ = false;
};

// Runs up to a turn's worth of a scheduled queue's jobs on the calling thread; what is left goes
// to the back of the pool's line, still scheduled, so other queues get a turn first.
void drainTurn(const StatePtr& state) {
  bool waitedOn = false;
  for (int n = 0;; ++n) {
    SerialQueue::Job job;
    {
      std::lock_guard lock(state->mutex);
      if (state->jobs.empty()) {
        state->scheduled = false;
        return;
      }
      if (n == kJobsPerTurn) {
        waitedOn = state->waiters > 0;
        break;
      }
      job = std::move(state->jobs.front());
      state->jobs.pop_front();
    }
    RunningScope scope(state.get());
    job();
  }
  WorkerPool::shared().submit(state, waitedOn);
}

// Queues `job`; `waiter` counts the caller among the queue's sync() waiters first.
void enqueue(const StatePtr& state, SerialQueue::Job job, bool waiter = false) {
  bool submit = false;
  bool waitedOn = false;
  {
    std::lock_guard lock(state->mutex);
    state->jobs.push_back(std::move(job));
    if (waiter) ++state->waiters;
    waitedOn = state->waiters > 0;
    if (state->manual) {
      state->jobsReady.notify_all();
    } else if (!state->scheduled) {
      state->scheduled = true;
      submit = true;
    }
  }
  if (submit) {
    WorkerPool::shared().submit(state, waitedOn);
  } else if (waiter && !state->manual) {
    WorkerPool::shared().expedite(state);
  }
}

[[noreturn]] void abortOnQueue(const std::string& message) {
  std::fprintf(stderr, "typhora: %s\n", message.c_str());
  std::fflush(stderr);
  std::abort();
}

std::shared_ptr<SerialQueue::State> makeState(std::string label, Clock* clock, bool manual) {
  auto state = std::make_shared<SerialQueue::State>();
  state->label = std::move(label);
  state->clock = clock != nullptr ? clock : &Clock::system();
  state->manual = manual;
  return state;
}

}  // namespace

SerialQueue::SerialQueue(std::shared_ptr<State> state) : state_(std::move(state)) {
  state_->owner = this;
}

SerialQueue::~SerialQueue() {
  std::lock_guard lock(state_->mutex);
  state_->owner = nullptr;
}

std::shared_ptr<SerialQueue> SerialQueue::create(std::string label, Clock* clock) {
  return std::shared_ptr<SerialQueue>(new SerialQueue(makeState(std::move(label), clock, false)));
}

std::shared_ptr<SerialQueue> SerialQueue::createManual(std::string label, Clock* clock) {
  return std::shared_ptr<SerialQueue>(new SerialQueue(makeState(std::move(label), clock, true)));
}

SerialQueue& SerialQueue::main() {
  // Made once and never released: the main queue lives as long as the process.
  static auto* queue = new std::shared_ptr<SerialQueue>(createManual("com.zorvane.main-queue"));
  return **queue;
}

const std::string& SerialQueue::label() const {
  return state_->label;
}

std::size_t SerialQueue::pendingJobs() const {
  std::lock_guard lock(state_->mutex);
  return state_->jobs.size();
}

void SerialQueue::async(Job job) {
  enqueue(state_, std::move(job));
}

bool SerialQueue::asyncClaiming(Job job) {
  if (state_->manual) {
    enqueue(state_, std::move(job));
    return false;
  }
  std::lock_guard lock(state_->mutex);
  state_->jobs.push_back(std::move(job));
  if (state_->scheduled) return false;
  state_->scheduled = true;
  return true;
}

void SerialQueue::drainClaimed() {
  drainTurn(state_);
}

void SerialQueue::sync(const Job& job) {
  if (isRunning(state_.get())) {
    abortOnQueue("sync onto queue '" + state_->label + "' from a job already running on it");
  }
  if (!state_->manual) {
    bool claimed = false;
    {
      std::lock_guard lock(state_->mutex);
      if (!state_->scheduled && state_->jobs.empty()) {
        state_->scheduled = true;
        claimed = true;
      }
    }
    if (claimed) {
      // The queue is idle: run the job here, as the queue's only runner.
      {
        RunningScope scope(state_.get());
        job();
      }
      bool resubmit = false;
      bool waitedOn = false;
      {
        std::lock_guard lock(state_->mutex);
        resubmit = !state_->jobs.empty();
        state_->scheduled = resubmit;
        waitedOn = state_->waiters > 0;
      }
      if (resubmit) WorkerPool::shared().submit(state_, waitedOn);
      return;
    }
  }
  Semaphore done;
  enqueue(
      state_,
      [&job, &done] {
        job();
        done.signal();
      },
      true);
  done.wait();
  std::lock_guard lock(state_->mutex);
  --state_->waiters;
}

void SerialQueue::asyncAfter(Duration delay, Job job) {
  std::shared_ptr<State> state = state_;
  state_->clock->schedule(delay, Duration::zero(), [state, job = std::move(job)]() mutable {
    enqueue(state, std::move(job));
  });
}

bool SerialQueue::isCurrent() const {
  return isRunning(state_.get());
}

void SerialQueue::assertCurrent(const char* where) const {
  if (!isCurrent()) {
    abortOnQueue(std::string(where) + " must run on queue '" + state_->label + "'");
  }
}

SerialQueue* SerialQueue::current() {
  if (runningStack.empty()) return nullptr;
  State* state = runningStack.back();
  std::lock_guard lock(state->mutex);
  return state->owner;
}

void SerialQueue::run() {
  for (;;) {
    Job job;
    {
      std::unique_lock lock(state_->mutex);
      state_->jobsReady.wait(lock, [this] { return !state_->jobs.empty(); });
      job = std::move(state_->jobs.front());
      state_->jobs.pop_front();
    }
    RunningScope scope(state_.get());
    job();
  }
}

std::size_t SerialQueue::runUntilIdle() {
  std::size_t ran = 0;
  for (;;) {
    Job job;
    {
      std::lock_guard lock(state_->mutex);
      if (state_->jobs.empty()) return ran;
      job = std::move(state_->jobs.front());
      state_->jobs.pop_front();
    }
    RunningScope scope(state_.get());
    job();
    ++ran;
  }
}

void SerialQueue::setPoolLimit(std::size_t limit) {
  WorkerPool::shared().setLimit(limit);
}
std::size_t SerialQueue::poolThreadCount() {
  return WorkerPool::shared().threads();
}

}  // namespace typhora
