// The process-wide gate of font requests: one request at a time holds the permit, from its
// admission until its release one second after its answer; the others wait in arrival order.
//
// Waiting holds no thread: a waiting request is a job that the release hands the permit to. A
// blocked caller would otherwise keep a worker of the shared pool for as long as the user takes
// to answer the dialog ahead of it, and enough of them would leave no worker to deliver that
// answer.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>

namespace typhora {

class RequestFontsGate {
 public:
  using Job = std::function<void()>;

  // Waiting requests beyond this many are refused: the queue stays bounded whatever a client
  // pipelines.
  static constexpr std::uint64_t kWaitingLimit = 256;

  // Counts a request in (`requestFontsWaiting`) and answers the count before it: not 0 means an
  // earlier request holds or waits for the permit.
  std::uint64_t arrive();
  // Counts a request out that arrive() counted but that will not take the permit.
  void leave();
  // Runs `admitted` once the permit is this request's: at once on the calling thread when the
  // gate is free, else on the thread that calls release() for the request ahead of it.
  // `admitted` must only queue work: it runs under no lock, but on another request's thread.
  void acquire(Job admitted);
  // Counts the holder out and passes the permit to the first waiting request, if any.
  void release();

  // `requestFontsWaiting`: requests that hold or wait for the permit.
  std::uint64_t waiting() const { return waiting_.load(); }

 private:
  std::atomic<std::uint64_t> waiting_{0};
  std::mutex mutex_;  // held_ and queue_
  bool held_ = false;
  std::deque<Job> queue_;
};

}  // namespace typhora
