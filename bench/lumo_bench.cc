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

#include "echo_service.h"
#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/proc_status.h"
#include "raw_socket_peer.h"

namespace typhora {
namespace {

bench::EchoService& fixture() {
  static auto* service = new bench::EchoService();
  return *service;
}

bool call(const std::shared_ptr<IpcRemoteProxy>& proxy, const char* op) {
  return bench::callEcho(proxy, op);
}

void BM_EmptyCallRoundTrip(benchmark::State& state) {
  auto connection = fixture().connect();
  auto proxy = connection->synchronousRemoteObjectProxy([](const std::string&) {});
  for (auto _ : state) {
    if (!call(proxy, "ping:")) state.SkipWithError("no reply");
  }
  // The raw ping-pong of the same size, in the same run; the ratio is lumo's time over it.
  const double raw = bench::rawRoundTrip(bench::EchoService::emptyCallFrameSize(), 20'000);
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
  state.SetBytesProcessed(state.iterations() *
                          static_cast<std::int64_t>(bench::EchoService::kLargeReplyBytes));
  connection->invalidate();
}
BENCHMARK(BM_LargeReply)->Unit(benchmark::kMillisecond)->UseRealTime();

// Both ends of each connection live in this process: the figures are per pair of ends.
void BM_ThousandIdleConnections(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    std::this_thread::sleep_for(std::chrono::seconds(6));  // let idle pool workers leave
    const long rssBefore = procStatusField(getpid(), "VmRSS:");
    const long threadsBefore = procStatusField(getpid(), "Threads:");
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
        static_cast<double>(procStatusField(getpid(), "VmRSS:") - rssBefore) / 1000.0;
    state.counters["threads_added"] =
        static_cast<double>(procStatusField(getpid(), "Threads:") - threadsBefore);
    for (auto& c : connections) c->invalidate();
    LumoAdmission::shared().setLimits({});
    state.ResumeTiming();
  }
}
BENCHMARK(BM_ThousandIdleConnections)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace typhora

BENCHMARK_MAIN();
