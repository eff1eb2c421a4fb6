// A one-shot, re-armable timer whose handler runs on a target queue.
#pragma once

#include <functional>
#include <memory>
#include <mutex>

#include "platform/dispatch/clock.h"
#include "platform/dispatch/serial_queue.h"

namespace typhora {

class OneShotTimer : public std::enable_shared_from_this<OneShotTimer> {
 public:
  enum class State { None, Pending, Fired };

  // `handler` runs on `queue` each time the timer fires.
  static std::shared_ptr<OneShotTimer> create(std::shared_ptr<SerialQueue> queue, Clock& clock,
                                              std::function<void()> handler);
  ~OneShotTimer();

  // Arms the timer to fire once, `delay` from now, within `leeway` after that. Arming a pending
  // timer replaces its deadline; arming a fired one makes it pending again.
  void schedule(Duration delay, Duration leeway);
  // A pending timer goes back to None without firing; otherwise nothing changes.
  void cancel();
  State state() const;

 private:
  OneShotTimer(std::shared_ptr<SerialQueue> queue, Clock& clock, std::function<void()> handler);
  void fired(std::uint64_t generation);

  std::shared_ptr<SerialQueue> queue_;
  Clock& clock_;
  std::function<void()> handler_;
  mutable std::mutex mutex_;
  State state_ = State::None;
  std::uint64_t generation_ = 0;
  std::shared_ptr<ClockAlarm> alarm_;
};

}  // namespace typhora
