#include "platform/linux/lumo/transport/lumo_event_loop.h"

#include <sys/epoll.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <thread>
#include <utility>

namespace typhora {

namespace {

// A follower that has not been given the lead for this long leaves.
constexpr auto kFollowerIdleExit = std::chrono::seconds(5);

// Loop threads that may run handlers' work at once. Past it, work goes to the worker pool as any
// queued job does, under the pool's own growth rules: blocking handlers cannot grow the loop's
// threads. One is enough for the path it shortens (a lone call, its caller waiting); while it is
// taken the loop is busy, and the pool's workers, awake across many jobs, cost fewer wake-ups
// than a hand-off per call.
constexpr std::size_t kMaxRunningWork = 1;

// Set on the leader while it runs the handlers of a batch of one ready descriptor. With several,
// the pool's workers are being woken for the others anyway, and a hand-off would add a wake-up
// to each batch of a busy loop rather than save one.
thread_local bool leadingBatch = false;
thread_local LumoEventLoop::Work workAfterBatch;

}  // namespace

LumoEventLoop& LumoEventLoop::shared() {
  static auto* loop = new LumoEventLoop();  // lives as long as the process
  return *loop;
}

LumoEventLoop::LumoEventLoop() : epoll_(epoll_create1(EPOLL_CLOEXEC)) {
  if (epoll_ < 0) {
    std::perror("lumo: epoll_create1");
    std::abort();
  }
  std::lock_guard lock(leadMutex_);
  startThreadLocked();
}

void LumoEventLoop::add(int fd, std::uint32_t events, Handler handler) {
  std::lock_guard lock(mutex_);
  const std::uint32_t generation = nextGeneration_++;
  handlers_[fd] = {generation, std::make_shared<Handler>(std::move(handler))};
  epoll_event event{};
  event.events = events;
  event.data.u64 = (static_cast<std::uint64_t>(generation) << 32) | static_cast<std::uint32_t>(fd);
  epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &event);
}

void LumoEventLoop::modify(int fd, std::uint32_t events) {
  std::lock_guard lock(mutex_);
  auto it = handlers_.find(fd);
  if (it == handlers_.end()) return;
  epoll_event event{};
  event.events = events;
  event.data.u64 =
      (static_cast<std::uint64_t>(it->second.generation) << 32) | static_cast<std::uint32_t>(fd);
  epoll_ctl(epoll_, EPOLL_CTL_MOD, fd, &event);
}

void LumoEventLoop::remove(int fd) {
  std::lock_guard lock(mutex_);
  if (handlers_.erase(fd) > 0) epoll_ctl(epoll_, EPOLL_CTL_DEL, fd, nullptr);
}

bool LumoEventLoop::canRunAfterHandoff() const {
  if (!leadingBatch || workAfterBatch) return false;
  // Only the leader adds to runningWork_, so a true answer holds until runAfterHandoff().
  std::lock_guard lock(leadMutex_);
  return runningWork_ < kMaxRunningWork;
}

void LumoEventLoop::runAfterHandoff(Work work) {
  workAfterBatch = std::move(work);
}

void LumoEventLoop::startThreadLocked() {
  std::thread([this] { threadMain(); }).detach();  // the loop lives as long as the process
}

// Gives up the lead: an idle follower takes it, or a new thread. Its wake-up runs beside the
// work this thread is about to do, not before it.
void LumoEventLoop::handOffLocked() {
  led_ = false;
  if (followers_ > 0) {
    leadFree_.notify_one();
  } else {
    startThreadLocked();
  }
}

void LumoEventLoop::threadMain() {
  std::unique_lock lock(leadMutex_);
  for (;;) {
    ++followers_;
    const bool lead = leadFree_.wait_for(lock, kFollowerIdleExit, [this] { return !led_; });
    --followers_;
    if (!lead) return;  // another thread leads
    led_ = true;
    for (;;) {
      lock.unlock();
      Work work = leadOneBatch();
      lock.lock();
      if (!work) continue;
      ++runningWork_;
      handOffLocked();
      lock.unlock();
      work();
      work = nullptr;  // what it holds goes before this thread waits again
      lock.lock();
      --runningWork_;
      break;
    }
  }
}

LumoEventLoop::Work LumoEventLoop::leadOneBatch() {
  epoll_event events[64];
  int n = epoll_wait(epoll_, events, 64, -1);
  if (n < 0) {
    if (errno == EINTR) return nullptr;
    std::perror("lumo: epoll_wait");
    std::abort();
  }
  leadingBatch = n == 1;
  for (int i = 0; i < n; ++i) {
    const int fd = static_cast<int>(events[i].data.u64 & 0xffffffffu);
    const auto generation = static_cast<std::uint32_t>(events[i].data.u64 >> 32);
    std::shared_ptr<Handler> handler;
    {
      std::lock_guard lock(mutex_);
      auto it = handlers_.find(fd);
      // A stale event of a descriptor removed (and maybe reused) since: ignore it.
      if (it == handlers_.end() || it->second.generation != generation) continue;
      handler = it->second.handler;
    }
    (*handler)(events[i].events);
  }
  leadingBatch = false;
  return std::exchange(workAfterBatch, nullptr);
}

}  // namespace typhora
