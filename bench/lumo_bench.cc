// lumo against raw Unix sockets: round trips, throughput, large replies and idle connections.
// Server and clients live in this process, on real sockets through the real I/O loop.
#include <benchmark/benchmark.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/linux/lumo/transport/lumo_frame.h"

namespace typhora {
namespace {

std::shared_ptr<const IpcInterface> benchInterface() {
  using K = IpcType::Kind;
  static const auto description = std::make_shared<const IpcInterface>(
      "Bench", std::vector<IpcOperation>{{"ping:", {}, true, {}},
                                         {"large:reply:", {}, true, {{K::Data, false}}}});
  return description;
}

class Server final : public IpcListenerDelegate,
                     public IpcExportedObject,
                     public std::enable_shared_from_this<Server> {
 public:
  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> c) override {
    c->setExportedInterface(benchInterface());
    c->setExportedObject(shared_from_this());
    c->resume();
    return true;
  }
  bool invoke(const IpcOperation& op, const std::vector<Value>&, IpcReply reply) override {
    if (op.wireName == "ping:") {
      reply({});
    } else {
      reply({large});
    }
    return true;
  }
  Value large = Value(Bytes(1'500'000, 0x5a));
};

struct Fixture {
  std::string dir;
  LumoService service;
  std::shared_ptr<Server> server = std::make_shared<Server>();
  std::shared_ptr<IpcListener> listener;

  static std::string makeDir() {
    char pattern[] = "/tmp/typhora-lumo-bench-XXXXXX";
    return mkdtemp(pattern);
  }
  Fixture() : dir(makeDir()), service(dir) {
    listener = service.makeNamedListener("bench");
    listener->setDelegate(server);
    listener->resume();
  }
  std::shared_ptr<IpcConnection> connect() {
    auto c = service.connectToService("bench");
    c->setRemoteInterface(benchInterface());
    c->resume();
    return c;
  }
};

Fixture& fixture() {
  static auto* f = new Fixture();
  return *f;
}

bool call(const std::shared_ptr<IpcRemoteProxy>& proxy, const char* op) {
  bool ok = false;
  proxy->call(op, {}, [&](std::vector<Value>) { ok = true; });
  return ok;
}

// Seconds per round trip of `bytes` bytes between two threads over a socket pair.
double rawRoundTrip(std::size_t bytes, int rounds) {
  int pair[2];
  socketpair(AF_UNIX, SOCK_STREAM, 0, pair);
  std::thread echo([fd = pair[1], bytes, rounds] {
    std::vector<char> buffer(bytes);
    for (int i = 0; i < rounds; ++i) {
      if (recv(fd, buffer.data(), bytes, MSG_WAITALL) <= 0) break;
      send(fd, buffer.data(), bytes, 0);
    }
  });
  std::vector<char> buffer(bytes, 'x');
  auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < rounds; ++i) {
    send(pair[0], buffer.data(), bytes, 0);
    recv(pair[0], buffer.data(), bytes, MSG_WAITALL);
  }
  double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  echo.join();
  close(pair[0]);
  close(pair[1]);
  return seconds / rounds;
}

std::size_t emptyCallFrameSize() {
  std::vector<std::uint8_t> frame;
  std::vector<int> fds;
  std::string error;
  encodeLumoFrame(LumoMessage{LumoMessage::Kind::Invoke, 1, "ping:", {}}, &frame, &fds, nullptr,
                  &error);
  return frame.size();
}

void BM_EmptyCallRoundTrip(benchmark::State& state) {
  auto connection = fixture().connect();
  auto proxy = connection->synchronousRemoteObjectProxy([](const std::string&) {});
  for (auto _ : state) {
    if (!call(proxy, "ping:")) state.SkipWithError("no reply");
  }
  // The raw ping-pong of the same size, in the same run; the ratio is lumo's time over it.
  const double raw = rawRoundTrip(emptyCallFrameSize(), 20'000);
  state.counters["raw_us"] = raw * 1e6;
  state.counters["calls/s"] =
      benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
  connection->invalidate();
}
BENCHMARK(BM_EmptyCallRoundTrip)->Unit(benchmark::kMicrosecond)->UseRealTime();

void BM_ConcurrentClients(benchmark::State& state) {
  auto connection = fixture().connect();
  auto proxy = connection->synchronousRemoteObjectProxy([](const std::string&) {});
  for (auto _ : state) call(proxy, "ping:");
  state.counters["calls/s"] =
      benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
  connection->invalidate();
}
BENCHMARK(BM_ConcurrentClients)->Threads(1)->Threads(4)->Threads(16)->UseRealTime();

void BM_LargeReply(benchmark::State& state) {
  auto connection = fixture().connect();
  auto proxy = connection->synchronousRemoteObjectProxy([](const std::string&) {});
  for (auto _ : state) {
    if (!call(proxy, "large:reply:")) state.SkipWithError("no reply");
  }
  state.SetBytesProcessed(state.iterations() * 1'500'000);
  connection->invalidate();
}
BENCHMARK(BM_LargeReply)->Unit(benchmark::kMillisecond)->UseRealTime();

long statusField(const char* name) {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind(name, 0) == 0) return std::stol(line.substr(std::strlen(name)));
  }
  return -1;
}

// Both ends of each connection live in this process: the figures are per pair of ends.
void BM_ThousandIdleConnections(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    std::this_thread::sleep_for(std::chrono::seconds(6));  // let idle pool workers leave
    const long rssBefore = statusField("VmRSS:");
    const long threadsBefore = statusField("Threads:");
    // One user's thousand connections: past what a service lets one user hold.
    LumoAdmission::shared().setLimits({2000, 64, 128u << 20, 64});
    std::vector<std::shared_ptr<IpcConnection>> connections;
    auto proxyOf = [](auto& c) {
      return c->synchronousRemoteObjectProxy([](const std::string&) {});
    };
    for (int i = 0; i < 1000; ++i) {
      connections.push_back(fixture().connect());
      call(proxyOf(connections.back()), "ping:");  // the server side is admitted and has served
    }
    std::this_thread::sleep_for(std::chrono::seconds(6));
    state.counters["KB_per_connection"] =
        static_cast<double>(statusField("VmRSS:") - rssBefore) / 1000.0;
    state.counters["threads_added"] = static_cast<double>(statusField("Threads:") - threadsBefore);
    for (auto& c : connections) c->invalidate();
    LumoAdmission::shared().setLimits({});
    state.ResumeTiming();
  }
}
BENCHMARK(BM_ThousandIdleConnections)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace typhora

BENCHMARK_MAIN();
