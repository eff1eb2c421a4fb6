#include "load_command.h"

#include "load_mix.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <iostream>
#include <memory>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/dispatch/semaphore.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/json_codec.h"

namespace typhora::ctl {
namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kUsage =
    "usage: typhoractl load [--connections N] [--calls M] OPERATION [JSON-ARGUMENT...]\n"
    "       typhoractl load --clients N [--seconds S] [--change-every S] [--request-every S]\n"
    "                       [--family NAME] [--changed-url URL]\n"
    "\n"
    "Opens N connections to the daemon (default 100), then has each send M calls of OPERATION\n"
    "(default 1) at once, and waits for every answer. Prints one JSON object: the counts, the\n"
    "time from the first call to the last answer, and the latencies of the answers (ms).\n"
    "\n"
    "With --clients: N client processes (default 50), each on its own connection, check in\n"
    "over and over for S seconds (default 60); each also reports a font change of URL every\n"
    "--change-every seconds (default 5) and requests family NAME (default DejaVu Sans) every\n"
    "--request-every seconds (default 60; requests pass the daemon one at a time), 0 for never.\n"
    "Prints one JSON object: per operation the calls, errors, calls per second and p50, p99 and\n"
    "max latency (ms); the font changes the clients were told of; the daemon's resident memory\n"
    "(kB) every 5 s and its threads at the end; and the errors. Stops by itself.\n";

struct Run {
  std::size_t connections = 100;
  std::size_t calls = 1;
  std::string wireName;
  std::vector<Value> arguments;
};

bool parse(std::vector<std::string> args, Run* run) {
  auto count = [](const std::string& text, std::size_t* out) {
    try {
      std::size_t used = 0;
      const unsigned long value = std::stoul(text, &used);
      *out = value;
      return used == text.size() && value > 0 && value <= 100000;
    } catch (...) {
      return false;
    }
  };
  while (args.size() >= 2 && args[0].starts_with("--")) {
    std::size_t* target = args[0] == "--connections" ? &run->connections
                          : args[0] == "--calls"     ? &run->calls
                                                     : nullptr;
    if (target == nullptr || !count(args[1], target)) return false;
    args.erase(args.begin(), args.begin() + 2);
  }
  if (args.empty()) return false;
  run->wireName = args[0];
  for (std::size_t i = 1; i < args.size(); ++i) {
    auto value = JsonCodec::decode(args[i]);
    if (!value) return false;
    run->arguments.push_back(std::move(*value));
  }
  return typhoraDaemonProtocol()->find(run->wireName) != nullptr;
}

// `--clients` and its options: the mixed run of client processes.
bool parseMix(std::vector<std::string> args, LoadPlan* plan) {
  auto number = [](const std::string& text, double* out, double max) {
    try {
      std::size_t used = 0;
      *out = std::stod(text, &used);
      return used == text.size() && *out >= 0 && *out <= max;
    } catch (...) {
      return false;
    }
  };
  while (args.size() >= 2 && args[0].starts_with("--")) {
    const std::string& value = args[1];
    double n = 0;
    if (args[0] == "--clients" && number(value, &n, 1000) && n >= 1) {
      plan->clients = static_cast<int>(n);
    } else if (args[0] == "--seconds" && number(value, &n, 3600) && n > 0) {
      plan->seconds = n;
    } else if (args[0] == "--change-every" && number(value, &n, 3600)) {
      plan->changeEverySeconds = n;
    } else if (args[0] == "--request-every" && number(value, &n, 3600)) {
      plan->requestEverySeconds = n;
    } else if (args[0] == "--family") {
      plan->family = value;
    } else if (args[0] == "--changed-url") {
      plan->changedUrl = value;
    } else {
      return false;
    }
    args.erase(args.begin(), args.begin() + 2);
  }
  return args.empty();
}

bool isMix(const std::vector<std::string>& args) {
  return std::any_of(args.begin(), args.end(), [](const std::string& arg) {
    return arg == "--clients" || arg == "--seconds" || arg == "--change-every" ||
           arg == "--request-every";
  });
}

}  // namespace

int runLoadCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  Run run;
  if (!args.empty() && (args[0] == "--help" || args[0] == "-h")) {
    std::cout << kUsage;
    return 0;
  }
  if (isMix(args)) {
    LoadPlan plan;
    if (!parseMix(args, &plan)) {
      std::cerr << kUsage;
      return 2;
    }
    return LoadMix(options, plan).run();
  }
  if (!parse(args, &run)) {
    std::cerr << kUsage;
    return 2;
  }
  LumoService service(options.runtimeDir);
  std::vector<std::shared_ptr<IpcConnection>> connections;
  for (std::size_t i = 0; i < run.connections; ++i) {
    auto connection = service.connectToService(kServiceName);
    connection->setRemoteInterface(typhoraDaemonProtocol());
    connection->resume();
    // Waits for the daemon's hello: connections are opened one handshake at a time, as a client
    // should, and the calls below all start together.
    connection->auditToken();
    connections.push_back(connection);
  }
  const std::size_t total = run.connections * run.calls;
  std::mutex mutex;
  std::vector<double> latencies;
  std::atomic<std::size_t> errors{0};
  Semaphore finished;
  const Clock::time_point start = Clock::now();
  for (auto& connection : connections) {
    auto proxy = connection->remoteObjectProxy([&](const std::string&) {
      ++errors;
      finished.signal();
    });
    for (std::size_t k = 0; k < run.calls; ++k) {
      const Clock::time_point sent = Clock::now();
      proxy->call(run.wireName, run.arguments, [&, sent](std::vector<Value>) {
        const std::chrono::duration<double, std::milli> took = Clock::now() - sent;
        {
          std::lock_guard lock(mutex);
          latencies.push_back(took.count());
        }
        finished.signal();
      });
    }
  }
  std::size_t done = 0;
  while (done < total && finished.waitFor(std::chrono::seconds(options.timeoutSeconds))) ++done;
  const std::chrono::duration<double, std::milli> elapsed = Clock::now() - start;
  for (auto& connection : connections) connection->invalidate();
  std::lock_guard lock(mutex);
  std::sort(latencies.begin(), latencies.end());
  auto count = [](std::size_t n) { return Value(static_cast<std::int64_t>(n)); };
  const Value report = Value::dictionary({
      {"connections", count(run.connections)},
      {"calls", count(total)},
      {"answered", count(latencies.size())},
      {"errors", count(errors.load())},
      {"ms", Value(elapsed.count())},
      {"p50", Value(percentile(latencies, 0.5))},
      {"p99", Value(percentile(latencies, 0.99))},
      {"max", Value(latencies.empty() ? 0.0 : latencies.back())},
  });
  std::cout << JsonCodec::encode(report) << "\n";
  return latencies.size() == total ? 0 : 1;
}

}  // namespace typhora::ctl
