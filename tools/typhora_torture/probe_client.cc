#include "probe_client.h"

#include <unistd.h>

#include <algorithm>

#include "support/raw_lumo_attacks.h"

namespace typhora::torture {

namespace {
constexpr int kAnswerTimeoutMs = 5000;
}

ProbeClient::ProbeClient(std::string socket, std::chrono::milliseconds pause)
    : socket_(std::move(socket)), pause_(pause) {}

ProbeClient::~ProbeClient() {
  stop();
}

void ProbeClient::start() {
  stop_ = false;
  thread_ = std::thread([this] { run(); });
}

void ProbeClient::stop() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
}

double ProbeClient::checkIn(int* fd, std::uint64_t id) {
  const auto start = Clock::now();
  if (*fd < 0) *fd = raw::connectedAndGreeted(socket_);
  if (*fd < 0) return -1;
  if (!raw::writeAll(*fd, raw::frameOf("checkin:", {}, id)) ||
      !raw::answerTo(*fd, id, kAnswerTimeoutMs)) {
    close(*fd);
    *fd = -1;
    return -1;
  }
  return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

void ProbeClient::run() {
  int fd = -1;
  for (std::uint64_t id = 1; !stop_; ++id) {
    const double ms = checkIn(&fd, id);
    {
      std::lock_guard lock(mutex_);
      samples_.push_back({Clock::now(), ms < 0 ? kAnswerTimeoutMs : ms, ms >= 0});
    }
    std::this_thread::sleep_for(pause_);
  }
  if (fd >= 0) close(fd);
}

ProbeClient::Window ProbeClient::window(Clock::time_point from, Clock::time_point to) const {
  std::vector<double> latencies;
  Window w;
  std::lock_guard lock(mutex_);
  for (const Sample& s : samples_) {
    if (s.at < from || s.at > to) continue;
    ++w.calls;
    if (!s.answered) ++w.failures;
    latencies.push_back(s.ms);
  }
  if (latencies.empty()) return w;
  std::sort(latencies.begin(), latencies.end());
  w.worstMs = latencies.back();
  w.p99Ms = latencies[std::min(latencies.size() - 1, latencies.size() * 99 / 100)];
  return w;
}

}  // namespace typhora::torture
