#include "load_mix.h"

#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <fstream>
#include <iostream>
#include <map>
#include <sstream>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/linux/proc_status.h"

namespace typhora::ctl {
namespace {

using Clock = std::chrono::steady_clock;

// How long past the run's end a worker may take to finish its last call and report.
constexpr auto kGrace = std::chrono::seconds(30);
constexpr auto kSampleEvery = std::chrono::seconds(5);

struct Totals {
  std::vector<double> latencies;
  long errors = 0;
};

}  // namespace

double percentile(const std::vector<double>& sorted, double p) {
  if (sorted.empty()) return 0;
  const auto at = static_cast<std::size_t>(p * static_cast<double>(sorted.size() - 1));
  return sorted[at];
}

LoadMix::LoadMix(const ClientOptions& options, const LoadPlan& plan)
    : options_(options), plan_(plan) {}

bool LoadMix::spawnWorkers() {
  for (int i = 0; i < plan_.clients; ++i) {
    int fds[2];
    if (pipe(fds) != 0) return false;
    const pid_t pid = fork();
    if (pid < 0) return false;
    if (pid == 0) {
      // This process has made no thread yet: the child starts from a clean copy.
      close(fds[0]);
      for (const Child& sibling : children_) close(sibling.fd);
      _exit(LoadWorker(options_, plan_, i).run(fds[1]));
    }
    close(fds[1]);
    children_.push_back({pid, fds[0], {}});
  }
  return true;
}

bool LoadMix::collect(pid_t daemon) {
  const Clock::time_point deadline =
      Clock::now() +
      std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(plan_.seconds)) +
      kGrace;
  Clock::time_point nextSample = Clock::now();
  std::size_t open = children_.size();
  while (open > 0 && Clock::now() < deadline) {
    if (Clock::now() >= nextSample) {
      rssSamples_.push_back(procStatusField(daemon, "VmRSS:"));
      nextSample += kSampleEvery;
    }
    std::vector<pollfd> fds;
    for (const Child& child : children_) {
      if (child.fd >= 0) fds.push_back({child.fd, POLLIN, 0});
    }
    if (poll(fds.data(), fds.size(), 500) < 0) break;
    for (Child& child : children_) {
      if (child.fd < 0) continue;
      pollfd one{child.fd, POLLIN, 0};
      if (poll(&one, 1, 0) <= 0) continue;
      char buffer[65536];
      const ssize_t n = read(child.fd, buffer, sizeof buffer);
      if (n > 0) {
        child.output.append(buffer, static_cast<std::size_t>(n));
        continue;
      }
      close(child.fd);
      child.fd = -1;
      --open;
    }
  }
  rssSamples_.push_back(procStatusField(daemon, "VmRSS:"));
  bool allFinished = true;
  for (Child& child : children_) {
    if (child.fd >= 0) {
      allFinished = false;
      kill(child.pid, SIGKILL);
      close(child.fd);
      child.fd = -1;
    }
    int status = 0;
    waitpid(child.pid, &status, 0);
  }
  if (!allFinished) errors_.push_back("some clients did not finish in time and were stopped");
  return allFinished;
}

int LoadMix::report(double elapsedSeconds, pid_t daemon) const {
  std::map<std::string, Totals> totals;
  long notifications = 0;
  std::vector<Value> errors(errors_.begin(), errors_.end());
  for (const Child& child : children_) {
    std::istringstream lines(child.output);
    std::string line;
    while (std::getline(lines, line)) {
      std::istringstream words(line);
      std::string name;
      words >> name;
      if (name == "notifications") {
        long count = 0;
        words >> count;
        notifications += count;
      } else if (name == "error") {
        if (errors.size() < 50) errors.emplace_back(line.substr(6));
      } else {
        Totals& total = totals[name];
        long failed = 0;
        words >> failed;
        total.errors += failed;
        for (double ms = 0; words >> ms;) total.latencies.push_back(ms);
      }
    }
  }
  std::vector<DictionaryEntry> operations;
  long failures = 0;
  for (auto& [name, total] : totals) {
    std::sort(total.latencies.begin(), total.latencies.end());
    failures += total.errors;
    const auto calls = static_cast<std::int64_t>(total.latencies.size());
    operations.emplace_back(
        name, Value::dictionary(
                  {{"calls", Value(calls)},
                   {"errors", Value(static_cast<std::int64_t>(total.errors))},
                   {"perSecond", Value(static_cast<double>(calls) / elapsedSeconds)},
                   {"p50", Value(percentile(total.latencies, 0.5))},
                   {"p99", Value(percentile(total.latencies, 0.99))},
                   {"max", Value(total.latencies.empty() ? 0.0 : total.latencies.back())}}));
  }
  ValueArray rss;
  for (long kb : rssSamples_) rss.emplace_back(static_cast<std::int64_t>(kb));
  const Value result = Value::dictionary({
      {"clients", Value(static_cast<std::int64_t>(plan_.clients))},
      {"seconds", Value(elapsedSeconds)},
      {"operations", Value(Dictionary(std::move(operations)))},
      {"notifications", Value(static_cast<std::int64_t>(notifications))},
      {"daemon", Value::dictionary({{"pid", Value(static_cast<std::int64_t>(daemon))},
                                    {"rssKB", Value(std::move(rss))},
                                    {"threads", Value(static_cast<std::int64_t>(
                                                    procStatusField(daemon, "Threads:")))}})},
      {"errors", Value(ValueArray(errors))},
  });
  std::cout << JsonCodec::encode(result) << "\n";
  return failures == 0 && errors.empty() ? 0 : 1;
}

int LoadMix::run() {
  const Clock::time_point start = Clock::now();
  if (!spawnWorkers()) {
    std::cerr << "typhoractl: cannot start the load's client processes\n";
    for (const Child& child : children_) kill(child.pid, SIGKILL);
  }
  // The daemon's pid is the peer of a connection of this process.
  LumoService service(options_.runtimeDir);
  auto connection = service.connectToService(kServiceName);
  connection->setRemoteInterface(typhoraDaemonProtocol());
  connection->resume();
  const pid_t daemon = connection->auditToken().pid;
  collect(daemon);
  connection->invalidate();
  const std::chrono::duration<double> elapsed = Clock::now() - start;
  return report(elapsed.count(), daemon);
}

}  // namespace typhora::ctl
