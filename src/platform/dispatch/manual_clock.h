// A clock that moves only when told to; alarms fire inside advance(), on the caller's thread,
// in deadline order. For tests of timers and delays measured in hours.
#pragma once

#include <mutex>
#include <vector>

#include "platform/dispatch/clock.h"

namespace typhora {

class ManualClock final : public Clock {
 public:
  explicit ManualClock(Date start = Date{1'800'000'000.0});
  Date now() const override;
  Duration uptime() const override;
  std::shared_ptr<ClockAlarm> schedule(Duration delay, Duration leeway,
                                       std::function<void()> fire) override;

  // Moves time forward by `by`, firing every alarm whose deadline is reached, each at its own
  // deadline (now() and uptime() read that deadline while it fires).
  void advance(Duration by);
  void setNow(Date date);  // moves the wall clock only (a clock change), fires nothing
  std::size_t pendingAlarms() const;
  // Deadline (as uptime) of the earliest pending alarm, if any.
  std::optional<Duration> nextDeadline() const;
  // The leeway the earliest pending alarm was scheduled with.
  std::optional<Duration> nextLeeway() const;

 private:
  struct Alarm;
  mutable std::mutex mutex_;
  Date wallAtZero_;
  Duration uptime_{0};
  std::uint64_t nextSequence_ = 0;
  std::vector<std::shared_ptr<Alarm>> alarms_;
};

}  // namespace typhora
