// The token exchange on the sandbox socket, in one process: what a sandboxed application pays
// to turn a token into a descriptor (connect, pin, verify, openat2, descriptor passing), beside
// opening the same file directly.
#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <memory>

#include "platform/linux/identity/app_manifest_store.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/linux/sandbox/linux_sandbox_broker.h"
#include "platform/linux/sandbox/sandbox_extension_client.h"
#include "platform/linux/sandbox/sandbox_extension_server.h"

namespace typhora {
namespace {

namespace fs = std::filesystem;

class ExchangeDevice {
 public:
  ExchangeDevice() {
    char pattern[] = "/tmp/typhora-exchange-bench-XXXXXX";
    dir_ = mkdtemp(pattern);
    fs::create_directories(dir_ / "root/var/fonts");
    fs::create_directories(dir_ / "run");
    std::ofstream(file()) << "font";
    manifests_ = std::make_unique<AppManifestStore>(root());
    broker_ = std::make_unique<LinuxSandboxBroker>(root(), *manifests_);
    server_ = std::make_unique<SandboxExtensionServer>(root(), (dir_ / "run").string(), *broker_);
    server_->start();
    token_ = broker_
                 ->issueReadOnlyExtension("/var/fonts/A.otf",
                                          ProcessIdentity::ofProcess(getpid(), getuid(), getgid()))
                 .value_or("");
  }
  ~ExchangeDevice() {
    server_.reset();
    fs::remove_all(dir_);
  }
  std::string root() const { return (dir_ / "root").string(); }
  std::string file() const { return (dir_ / "root/var/fonts/A.otf").string(); }
  std::string runtime() const { return (dir_ / "run").string(); }
  const std::string& token() const { return token_; }

 private:
  fs::path dir_;
  std::unique_ptr<AppManifestStore> manifests_;
  std::unique_ptr<LinuxSandboxBroker> broker_;
  std::unique_ptr<SandboxExtensionServer> server_;
  std::string token_;
};

void BM_TokenExchange(benchmark::State& state) {
  ExchangeDevice device;
  const SandboxExtensionClient client(device.runtime());
  for (auto _ : state) {
    SandboxExtensionResult result = client.open(device.token());
    if (!result.fd.valid()) {
      state.SkipWithError(result.error.c_str());
      return;
    }
  }
  state.counters["exchanges_per_s"] =
      benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_TokenExchange)->UseRealTime();

void BM_DirectOpen(benchmark::State& state) {
  ExchangeDevice device;
  const std::string file = device.file();
  for (auto _ : state) {
    const int fd = open(file.c_str(), O_RDONLY | O_CLOEXEC);
    benchmark::DoNotOptimize(fd);
    close(fd);
  }
}
BENCHMARK(BM_DirectOpen);

}  // namespace
}  // namespace typhora

BENCHMARK_MAIN();
