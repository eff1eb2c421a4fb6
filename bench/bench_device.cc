#include "bench_device.h"

#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/cbor_codec.h"

namespace typhora::bench {
namespace {

namespace fs = std::filesystem;

const std::string kDaemon = std::string(TYPHORA_BINARY_DIR) + "/src/typhorad";

std::string sha256Of(const std::string& path) {
  const std::string command = "sha256sum '" + path + "'";
  FILE* pipe = popen(command.c_str(), "r");
  char digest[65] = {};
  if (pipe == nullptr) return {};
  if (std::fread(digest, 1, 64, pipe) != 64) digest[0] = 0;
  pclose(pipe);
  return digest;
}

}  // namespace

Value userFontsOf(int records) {
  std::vector<DictionaryEntry> entries;
  entries.reserve(static_cast<std::size_t>(records));
  for (int i = 0; i < records; ++i) {
    std::vector<DictionaryEntry> names;
    const std::string family = "Family " + std::to_string(i);
    for (int k = 0; k < 1 + i % 4; ++k) {
      names.emplace_back("Family" + std::to_string(i) + "-Style" + std::to_string(k), family);
    }
    entries.emplace_back("/var/mobile/Library/UserFonts/FontFiles/com.example.provider" +
                             std::to_string(i % 50) + "/Family" + std::to_string(i) + ".otf",
                         Value::dictionary({{"familyName", Value(Dictionary(std::move(names)))},
                                            {"disabled", Value(i % 7 == 0)},
                                            {"fontAssetName", Value(family)},
                                            {"installDate", Value(Date{1.7e9 + i})},
                                            {"fileSize", Value(100'000 + i)}}));
  }
  return Value(Dictionary(std::move(entries)));
}

BenchDevice::BenchDevice(int fonts) {
  char pattern[] = "/tmp/typhora-compare-XXXXXX";
  dir_ = mkdtemp(pattern);
  // Clients of other users (the fan-out's crowd) reach the socket through these.
  chmod(dir_.c_str(), 0755);
  const fs::path root = this->root();
  fs::create_directories(root / "var/mobile/Library/UserFonts");
  fs::create_directories(runtimeDir());
  chmod(runtimeDir().c_str(), 0755);
  const Bytes bytes = CborCodec::encode(userFontsOf(fonts));
  std::ofstream(userFontsFile(), std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()),
             static_cast<std::streamsize>(bytes.size()));
  const std::string self = fs::canonical("/proc/self/exe").string();
  fs::create_directories(root / "etc/typhora/apps");
  std::ofstream(root / "etc/typhora/typhorad.launch.plist") << "{}";
  std::ofstream(root / "etc/typhora/apps/compare.plist")
      << R"({"identifier": "com.example.compare", "executable": ")" << self << R"(", "sha256": ")"
      << sha256Of(self)
      << R"(", "entitlements": {"com.zorvane.developer.user-fonts": ["font-enumeration"]},)"
      << R"( "sandbox": {"readOnlyPaths": []}})";
}

BenchDevice::~BenchDevice() {
  stop();
  std::error_code ec;
  fs::remove_all(dir_, ec);
}

std::string BenchDevice::userFontsFile() const {
  return root() + "/var/mobile/Library/UserFonts/UserFonts.plist";
}

bool BenchDevice::rewriteUserFonts() const {
  const std::string file = userFontsFile();
  const std::string temporary = file + ".rewrite";
  std::error_code ec;
  fs::copy_file(file, temporary, fs::copy_options::overwrite_existing, ec);
  if (!ec) fs::rename(temporary, file, ec);
  return !ec;
}

// posix_spawn, not fork: copying this process's page tables (fontconfig's 10,000 fonts among
// them) is the benchmark's cost, not the daemon's start.
void BenchDevice::spawn() {
  fs::remove(fs::path(runtimeDir()) / kServiceName);
  const std::string root = this->root();
  const std::string run = runtimeDir();
  const char* argv[] = {kDaemon.c_str(), "--root", root.c_str(),   "--runtime-dir", run.c_str(),
                        "--log-level",   "error",  "--log-target", "stderr",        nullptr};
  if (posix_spawn(&pid_, kDaemon.c_str(), nullptr, nullptr, const_cast<char* const*>(argv),
                  environ) != 0) {
    pid_ = -1;
  }
}

bool BenchDevice::start() {
  spawn();
  const fs::path socket = fs::path(runtimeDir()) / kServiceName;
  for (int i = 0; i < 2000 && !fs::exists(socket); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return fs::exists(socket);
}

void BenchDevice::stop() {
  if (pid_ <= 0) return;
  kill(pid_, SIGKILL);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

std::shared_ptr<IpcConnection> BenchDevice::connect(LumoService& service) const {
  auto connection = service.connectToService(kServiceName);
  connection->setRemoteInterface(typhoraDaemonProtocol());
  connection->resume();
  connection->auditToken();  // waits for the daemon's hello
  return connection;
}

Value checkIn(const std::shared_ptr<IpcConnection>& connection) {
  Value answer;
  connection->synchronousRemoteObjectProxy([](const std::string&) {})
      ->call(op::kCheckin, {}, [&answer](std::vector<Value> reply) {
        if (!reply.empty()) answer = std::move(reply[0]);
      });
  return answer;
}

}  // namespace typhora::bench
