#include "platform/dispatch/semaphore.h"

namespace typhora {

void Semaphore::signal() {
  // Notify under the lock: a waiter that wakes may destroy the semaphore as soon as it can take
  // the mutex, so the notification must be over by then.
  std::lock_guard lock(mutex_);
  ++count_;
  cv_.notify_one();
}

void Semaphore::wait() {
  std::unique_lock lock(mutex_);
  cv_.wait(lock, [this] { return count_ > 0; });
  --count_;
}

bool Semaphore::waitFor(std::chrono::nanoseconds timeout) {
  std::unique_lock lock(mutex_);
  if (!cv_.wait_for(lock, timeout, [this] { return count_ > 0; })) return false;
  --count_;
  return true;
}

}  // namespace typhora
