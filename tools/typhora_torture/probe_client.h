// The well-behaved client of a torture run: one connection that checks in again and again,
// timing each answer, and reconnects when the daemon drops it. Samples carry their time so each
// attack's window can be read out afterwards.
#pragma once

#include <atomic>
#include <chrono>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace typhora::torture {

class ProbeClient {
 public:
  using Clock = std::chrono::steady_clock;

  struct Window {
    std::size_t calls = 0;
    std::size_t failures = 0;  // unanswered within the timeout, or no connection at all
    double worstMs = 0;
    double p99Ms = 0;
  };

  explicit ProbeClient(std::string socket, std::chrono::milliseconds pause);
  ~ProbeClient();
  ProbeClient(const ProbeClient&) = delete;
  ProbeClient& operator=(const ProbeClient&) = delete;

  void start();
  void stop();
  // What the probe saw between `from` and `to`.
  Window window(Clock::time_point from, Clock::time_point to) const;

 private:
  struct Sample {
    Clock::time_point at;
    double ms;
    bool answered;
  };
  void run();
  // One check-in on `*fd` (connecting first when it is -1); its latency, or a negative value.
  double checkIn(int* fd, std::uint64_t id);

  std::string socket_;
  std::chrono::milliseconds pause_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
  mutable std::mutex mutex_;
  std::vector<Sample> samples_;
};

}  // namespace typhora::torture
