#include "platform/dispatch/system_clock.h"

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <queue>
#include <thread>
#include <vector>

namespace typhora {
namespace {

using Steady = std::chrono::steady_clock;

struct SystemAlarm final : ClockAlarm {
  Steady::time_point deadline;
  std::function<void()> fire;
  std::atomic<bool> cancelled{false};
  void cancel() override { cancelled = true; }
};

struct Later {
  bool operator()(const std::shared_ptr<SystemAlarm>& a,
                  const std::shared_ptr<SystemAlarm>& b) const {
    return a->deadline > b->deadline;
  }
};

}  // namespace

// One timer thread for all alarms of a clock: a min-heap of deadlines. Alarms fire at their
// deadline; the leeway is not used to delay them.
struct SystemClock::State {
  std::mutex mutex;
  std::condition_variable changed;
  std::priority_queue<std::shared_ptr<SystemAlarm>, std::vector<std::shared_ptr<SystemAlarm>>,
                      Later>
      alarms;
  bool stopping = false;
  std::thread thread;

  void loop() {
    std::unique_lock lock(mutex);
    while (!stopping) {
      if (alarms.empty()) {
        changed.wait(lock);
        continue;
      }
      auto next = alarms.top();
      if (next->cancelled) {
        alarms.pop();
        continue;
      }
      if (Steady::now() < next->deadline) {
        changed.wait_until(lock, next->deadline);
        continue;
      }
      alarms.pop();
      lock.unlock();
      if (!next->cancelled) next->fire();
      lock.lock();
    }
  }
};

SystemClock::SystemClock() : state_(std::make_shared<State>()) {
  state_->thread = std::thread([state = state_] { state->loop(); });
}

SystemClock::~SystemClock() {
  {
    std::lock_guard lock(state_->mutex);
    state_->stopping = true;
  }
  state_->changed.notify_all();
  state_->thread.join();
}

Date SystemClock::now() const {
  auto since = std::chrono::system_clock::now().time_since_epoch();
  return Date{std::chrono::duration<double>(since).count()};
}

Duration SystemClock::uptime() const {
  return std::chrono::duration_cast<Duration>(Steady::now().time_since_epoch());
}

std::shared_ptr<ClockAlarm> SystemClock::schedule(Duration delay, Duration /*leeway*/,
                                                  std::function<void()> fire) {
  auto alarm = std::make_shared<SystemAlarm>();
  alarm->deadline = Steady::now() + std::max(delay, Duration::zero());
  alarm->fire = std::move(fire);
  {
    std::lock_guard lock(state_->mutex);
    state_->alarms.push(alarm);
  }
  state_->changed.notify_all();
  return alarm;
}

Clock& Clock::system() {
  static auto* clock = new SystemClock();  // lives as long as the process
  return *clock;
}

}  // namespace typhora
