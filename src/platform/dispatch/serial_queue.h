// Serial queues: jobs of one queue run one at a time, in order; different queues run in parallel
// on a shared pool of worker threads. The pool grows while jobs block (a job waiting in sync() or
// on a semaphore holds its worker), up to a cap, and idle workers go away, so an idle queue costs
// no thread.
//
// A manual queue (the main queue among them) runs its jobs only on the thread that calls run() or
// runUntilIdle() on it.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>

#include "platform/dispatch/clock.h"

namespace typhora {

class SerialQueue : public std::enable_shared_from_this<SerialQueue> {
 public:
  using Job = std::function<void()>;

  // A queue served by the worker pool. Delays go through `clock` (the system clock when null).
  static std::shared_ptr<SerialQueue> create(std::string label, Clock* clock = nullptr);
  // A queue whose jobs run only inside run() / runUntilIdle().
  static std::shared_ptr<SerialQueue> createManual(std::string label, Clock* clock = nullptr);
  // The process-wide main queue (manual), driven by run() on the main thread.
  static SerialQueue& main();

  virtual ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const;
  // Jobs queued and not yet started (delayed jobs count once their delay has passed).
  std::size_t pendingJobs() const;

  void async(Job job);
  // Queues `job` like async(), but when the queue is idle it is claimed for the caller instead of
  // going to the pool, and the answer is true: the caller must then call drainClaimed(), on the
  // thread of its choice, without waiting on anything first. Jobs queued meanwhile wait for it.
  bool asyncClaiming(Job job);
  // Runs a claimed queue's jobs on the calling thread, up to a turn's worth, then gives what is
  // left to the pool.
  void drainClaimed();
  // Runs `job` on this queue and waits for it. From a job already running on this queue (also
  // through a chain of sync calls) it aborts the process with a message naming the queue.
  void sync(const Job& job);
  // Queues `job` once `delay` has passed on the queue's clock.
  void asyncAfter(Duration delay, Job job);

  // True while the calling thread runs a job of this queue, directly or through sync() chains.
  bool isCurrent() const;
  // Aborts (in every build) with a message naming this queue and `where` when !isCurrent().
  void assertCurrent(const char* where) const;
  // The innermost queue whose job the calling thread runs, or nullptr.
  static SerialQueue* current();

  // Manual queues only: runs jobs on the calling thread. run() never returns; runUntilIdle()
  // returns once the queue is empty and answers how many jobs ran.
  [[noreturn]] void run();
  std::size_t runUntilIdle();

  // Cap of the shared worker pool (default 64). Takes effect for workers started later.
  static void setPoolLimit(std::size_t limit);
  static std::size_t poolThreadCount();  // workers alive now

  // The queue's shared state (opaque; jobs in flight keep it alive).
  struct State;

 protected:
  explicit SerialQueue(std::shared_ptr<State> state);

 private:
  std::shared_ptr<State> state_;
};

// Debug-build assertion that the current job runs on `queue` (a SerialQueue or a pointer to one).
#ifndef NDEBUG
#define TY_ASSERT_ON_QUEUE(queue) (queue).assertCurrent(__func__)
#else
#define TY_ASSERT_ON_QUEUE(queue) ((void)0)
#endif

}  // namespace typhora
