// A counting semaphore (signal / wait), as used for the request gate and for waiting on
// completion handlers that run on other threads.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace typhora {

class Semaphore {
 public:
  explicit Semaphore(long count = 0) : count_(count) {}
  void signal();
  void wait();
  // Waits at most `timeout` (real time); true when a permit was taken.
  bool waitFor(std::chrono::nanoseconds timeout);

 private:
  std::mutex mutex_;
  std::condition_variable cv_;
  long count_;
};

}  // namespace typhora
