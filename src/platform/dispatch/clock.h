// Every "now" and every delay of the daemon goes through a Clock, so tests can drive time.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

#include "platform/value/value.h"

namespace typhora {

using Duration = std::chrono::nanoseconds;

// A scheduled callback; cancel() makes sure it does not run if it has not started yet.
class ClockAlarm {
 public:
  virtual ~ClockAlarm() = default;
  virtual void cancel() = 0;
};

class Clock {
 public:
  virtual ~Clock() = default;
  // Wall-clock time (dates stored in preferences, due dates).
  virtual Date now() const = 0;
  // Monotonic time since an arbitrary origin (deadlines of timers).
  virtual Duration uptime() const = 0;
  // Calls `fire` once, on a thread of the clock's choosing, no earlier than `delay` from now and
  // preferably before `delay + leeway`. `fire` must be short: it normally just queues work.
  virtual std::shared_ptr<ClockAlarm> schedule(Duration delay, Duration leeway,
                                               std::function<void()> fire) = 0;

  // The process-wide system clock.
  static Clock& system();
};

}  // namespace typhora
