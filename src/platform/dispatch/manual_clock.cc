#include "platform/dispatch/manual_clock.h"

#include <algorithm>
#include <atomic>

namespace typhora {

struct ManualClock::Alarm final : ClockAlarm {
  Duration deadline{0};
  Duration leeway{0};
  std::uint64_t sequence = 0;
  std::function<void()> fire;
  std::atomic<bool> cancelled{false};
  void cancel() override { cancelled = true; }
};

ManualClock::ManualClock(Date start) : wallAtZero_(start) {}

Date ManualClock::now() const {
  std::lock_guard lock(mutex_);
  return Date{wallAtZero_.secondsSince1970 + std::chrono::duration<double>(uptime_).count()};
}

Duration ManualClock::uptime() const {
  std::lock_guard lock(mutex_);
  return uptime_;
}

std::shared_ptr<ClockAlarm> ManualClock::schedule(Duration delay, Duration leeway,
                                                  std::function<void()> fire) {
  auto alarm = std::make_shared<Alarm>();
  alarm->fire = std::move(fire);
  alarm->leeway = leeway;
  std::lock_guard lock(mutex_);
  alarm->deadline = uptime_ + std::max(delay, Duration::zero());
  alarm->sequence = nextSequence_++;
  alarms_.push_back(alarm);
  return alarm;
}

void ManualClock::advance(Duration by) {
  std::unique_lock lock(mutex_);
  const Duration target = uptime_ + by;
  for (;;) {
    std::erase_if(alarms_, [](const auto& a) { return a->cancelled.load(); });
    auto earliest =
        std::min_element(alarms_.begin(), alarms_.end(), [](const auto& a, const auto& b) {
          return a->deadline != b->deadline ? a->deadline < b->deadline : a->sequence < b->sequence;
        });
    if (earliest == alarms_.end() || (*earliest)->deadline > target) break;
    std::shared_ptr<Alarm> alarm = *earliest;
    alarms_.erase(earliest);
    uptime_ = std::max(uptime_, alarm->deadline);
    lock.unlock();
    alarm->fire();  // may schedule more alarms, which fire in this advance when due
    lock.lock();
  }
  uptime_ = target;
}

void ManualClock::setNow(Date date) {
  std::lock_guard lock(mutex_);
  wallAtZero_ = Date{date.secondsSince1970 - std::chrono::duration<double>(uptime_).count()};
}

std::size_t ManualClock::pendingAlarms() const {
  std::lock_guard lock(mutex_);
  return static_cast<std::size_t>(
      std::count_if(alarms_.begin(), alarms_.end(), [](const auto& a) { return !a->cancelled; }));
}

std::optional<Duration> ManualClock::nextDeadline() const {
  std::lock_guard lock(mutex_);
  std::optional<Duration> next;
  for (const auto& a : alarms_) {
    if (!a->cancelled && (!next || a->deadline < *next)) next = a->deadline;
  }
  return next;
}

std::optional<Duration> ManualClock::nextLeeway() const {
  std::lock_guard lock(mutex_);
  const Alarm* next = nullptr;
  for (const auto& a : alarms_) {
    if (!a->cancelled && (next == nullptr || a->deadline < next->deadline)) next = a.get();
  }
  return next != nullptr ? std::optional(next->leeway) : std::nullopt;
}

}  // namespace typhora
