// The real clock: wall time from the system, alarms on one shared timer thread.
#pragma once

#include "platform/dispatch/clock.h"

namespace typhora {

class SystemClock final : public Clock {
 public:
  SystemClock();
  ~SystemClock() override;
  Date now() const override;
  Duration uptime() const override;
  std::shared_ptr<ClockAlarm> schedule(Duration delay, Duration leeway,
                                       std::function<void()> fire) override;

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace typhora
