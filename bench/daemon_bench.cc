// Cold start of the real typhorad: from exec to the first answered call, with a user-fonts file
// of 10,000 records, and the daemon's resident memory once that file is loaded.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <thread>

#include "bench_device.h"
#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/cbor_codec.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/linux/proc_status.h"

namespace typhora {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

const std::string kDaemon = std::string(TYPHORA_BINARY_DIR) + "/src/typhorad";

struct Device {
  fs::path dir;
  Device() {
    char pattern[] = "/tmp/typhora-bench-XXXXXX";
    dir = mkdtemp(pattern);
    fs::create_directories(dir / "root/var/mobile/Library/UserFonts");
    fs::create_directories(dir / "run");
    Bytes bytes = CborCodec::encode(bench::userFontsOf(10'000));
    std::ofstream(dir / "root/var/mobile/Library/UserFonts/UserFonts.plist", std::ios::binary)
        .write(reinterpret_cast<const char*>(bytes.data()),
               static_cast<std::streamsize>(bytes.size()));
  }
  ~Device() { fs::remove_all(dir); }
};

pid_t startDaemon(const Device& device) {
  fs::remove(device.dir / "run" / kServiceName);
  pid_t pid = fork();
  if (pid == 0) {
    std::string root = (device.dir / "root").string();
    std::string run = (device.dir / "run").string();
    execl(kDaemon.c_str(), kDaemon.c_str(), "--root", root.c_str(), "--runtime-dir", run.c_str(),
          "--log-level", "error", static_cast<char*>(nullptr));
    _exit(127);
  }
  return pid;
}

// Connects until the service answers updatingUserFonts: once.
bool firstAnsweredCall(LumoService& service, const Device& device) {
  const fs::path socket = device.dir / "run" / kServiceName;
  for (int attempt = 0; attempt < 20'000; ++attempt) {
    if (fs::exists(socket)) {
      auto connection = service.connectToService(kServiceName);
      connection->setRemoteInterface(typhoraDaemonProtocol());
      connection->resume();
      bool answered = false;
      connection->synchronousRemoteObjectProxy([](const std::string&) {})
          ->call(op::kUpdatingUserFonts, {}, [&answered](std::vector<Value>) { answered = true; });
      connection->invalidate();
      if (answered) return true;
    }
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  return false;
}

void BM_ColdStartToFirstAnsweredCall(benchmark::State& state) {
  Device device;
  Device* d = &device;
  long rss = 0;
  for (auto _ : state) {
    LumoService service((d->dir / "run").string());
    auto start = Clock::now();
    pid_t pid = startDaemon(*d);
    bool ok = firstAnsweredCall(service, *d);
    auto elapsed = std::chrono::duration<double>(Clock::now() - start).count();
    // The preload may still be reading when the first call is answered: let it finish.
    std::this_thread::sleep_for(std::chrono::milliseconds(150));
    rss = procStatusField(pid, "VmRSS:");
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    if (!ok) {
      state.SkipWithError("the daemon never answered");
      break;
    }
    state.SetIterationTime(elapsed);
  }
  state.counters["daemon_rss_MB"] = static_cast<double>(rss) / 1024.0;
}
BENCHMARK(BM_ColdStartToFirstAnsweredCall)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(20);

}  // namespace
}  // namespace typhora

BENCHMARK_MAIN();
