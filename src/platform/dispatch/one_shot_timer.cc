#include "platform/dispatch/one_shot_timer.h"

namespace typhora {

std::shared_ptr<OneShotTimer> OneShotTimer::create(std::shared_ptr<SerialQueue> queue, Clock& clock,
                                                   std::function<void()> handler) {
  return std::shared_ptr<OneShotTimer>(
      new OneShotTimer(std::move(queue), clock, std::move(handler)));
}

OneShotTimer::OneShotTimer(std::shared_ptr<SerialQueue> queue, Clock& clock,
                           std::function<void()> handler)
    : queue_(std::move(queue)), clock_(clock), handler_(std::move(handler)) {}

OneShotTimer::~OneShotTimer() {
  std::lock_guard lock(mutex_);
  if (alarm_) alarm_->cancel();
}

void OneShotTimer::schedule(Duration delay, Duration leeway) {
  std::lock_guard lock(mutex_);
  if (alarm_) alarm_->cancel();
  const std::uint64_t generation = ++generation_;
  state_ = State::Pending;
  std::weak_ptr<OneShotTimer> weak = weak_from_this();
  alarm_ = clock_.schedule(delay, leeway, [weak, generation] {
    if (auto timer = weak.lock()) timer->fired(generation);
  });
}

void OneShotTimer::cancel() {
  std::lock_guard lock(mutex_);
  if (state_ != State::Pending) return;
  ++generation_;
  if (alarm_) alarm_->cancel();
  alarm_.reset();
  state_ = State::None;
}

OneShotTimer::State OneShotTimer::state() const {
  std::lock_guard lock(mutex_);
  return state_;
}

void OneShotTimer::fired(std::uint64_t generation) {
  {
    std::lock_guard lock(mutex_);
    // A cancelled or re-armed timer's old alarm never runs the handler.
    if (generation != generation_ || state_ != State::Pending) return;
    state_ = State::Fired;
    alarm_.reset();
  }
  queue_->async([self = shared_from_this()] { self->handler_(); });
}

}  // namespace typhora
