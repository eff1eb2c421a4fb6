// typhora against what a Linux platform engineer would use instead, workload by workload, each
// pair measured in the same run: raw Unix sockets, D-Bus through sd-bus on a dbus-daemon started
// for the run, and fontconfig over the same number of real font files. Prints one table of
// medians over rounds, their spread and the ratio typhora / peer.
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>

#include "bench_device.h"
#include "comparison_table.h"
#include "daemon/typhora_daemon.h"
#include "echo_service.h"
#include "fanout_crowd.h"
#include "font_corpus.h"
#include "ipc/interface_descriptions.h"
#include "platform/linux/linux_platform.h"
#include "platform/linux/proc_status.h"
#include "platform/log/log.h"
#include "platform/value/cbor_codec.h"
#include "private_bus.h"
#include "raw_socket_peer.h"

namespace typhora::bench {
namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kUsage =
    "usage: compare [--rounds N] [--only WORKLOAD] [--without-bus]\n"
    "\n"
    "Runs each workload against its peer in this process run, N rounds (default 5), and prints\n"
    "medians, spreads and ratios. WORKLOAD: empty-call, checkin, names, fanout, cold-start.\n"
    "--without-bus leaves the D-Bus peer out (its rows stay 0), as when profiling the daemon.\n";

struct Options {
  int rounds = 5;
  std::string only;
  bool withBus = true;
};

double secondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

// Seconds per iteration of `body` run `times` times.
double timePer(int times, const std::function<void()>& body) {
  const auto start = Clock::now();
  for (int i = 0; i < times; ++i) body();
  return secondsSince(start) / times;
}

std::string loadAverage() {
  std::ifstream file("/proc/loadavg");
  std::string one, five, fifteen;
  file >> one >> five >> fifteen;
  return "load average " + one + " " + five + " " + fifteen;
}

class Comparison {
 public:
  explicit Comparison(Options options) : options_(std::move(options)) {}

  int run();

 private:
  bool wanted(const char* workload) const {
    return options_.only.empty() || options_.only == workload;
  }
  BenchDevice& device(int fonts);
  void emptyCall();
  void checkIn(int fonts);
  void nameResolution();
  void fanout();
  void coldStart();

  Options options_;
  ComparisonTable table_;
  std::unique_ptr<PrivateBus> bus_;
  std::unique_ptr<BusServer> busServer_;
  sd_bus* busClient_ = nullptr;
  std::map<int, std::unique_ptr<BenchDevice>> devices_;
  std::unique_ptr<FontCorpus> corpus_;
  std::vector<std::string> memory_;
};

BenchDevice& Comparison::device(int fonts) {
  auto& slot = devices_[fonts];
  if (!slot) slot = std::make_unique<BenchDevice>(fonts);
  return *slot;
}

void Comparison::emptyCall() {
  EchoService echo;
  auto connection = echo.connect();
  auto proxy = connection->synchronousRemoteObjectProxy([](const std::string&) {});
  const std::size_t frame = EchoService::emptyCallFrameSize();
  constexpr int kCalls = 2000;
  ComparisonRow raw{"empty call round trip", "us/call", {}, "raw socket ping-pong", {}};
  ComparisonRow dbus{"empty call round trip", "us/call", {}, "D-Bus method call (sd-bus)", {}};
  for (int round = 0; round < options_.rounds; ++round) {
    const double lumo = timePer(kCalls, [&] { callEcho(proxy, "ping:"); }) * 1e6;
    raw.typhora.values.push_back(lumo);
    dbus.typhora.values.push_back(lumo);
    raw.peerSamples.values.push_back(rawRoundTrip(frame, kCalls) * 1e6);
    if (busClient_ != nullptr) {
      dbus.peerSamples.values.push_back(timePer(kCalls / 4, [&] { callBus(busClient_, "Ping"); }) *
                                        1e6);
    }
  }
  connection->invalidate();
  table_.add(std::move(raw));
  table_.add(std::move(dbus));
}

void Comparison::checkIn(int fonts) {
  BenchDevice& device = this->device(fonts);
  if (!device.start()) {
    std::fprintf(stderr, "compare: the daemon did not start\n");
    return;
  }
  LumoService service(device.runtimeDir());
  auto connection = device.connect(service);
  const Value answer = bench::checkIn(connection);
  const std::size_t bytes = CborCodec::encode(answer).size();
  const std::size_t entries = answer.get("fontsInfo").asDictionary() != nullptr
                                  ? answer.get("fontsInfo").asDictionary()->size()
                                  : 0;
  std::fprintf(stderr, "compare: check-in at %d fonts answers %zu fonts in %zu bytes\n", fonts,
               entries, bytes);
  if (busServer_) busServer_->setAnswer(answer);
  const int calls = fonts >= 10'000 ? 10 : 50;
  const std::string workload = "check-in, " + std::to_string(fonts) + " fonts";
  ComparisonRow raw{workload, "ms/call", {}, "raw transfer, same bytes", {}};
  ComparisonRow dbus{workload, "ms/call", {}, "same answer as D-Bus reply", {}};
  for (int round = 0; round < options_.rounds; ++round) {
    const double ours = timePer(calls, [&] { bench::checkIn(connection); }) * 1e3;
    raw.typhora.values.push_back(ours);
    dbus.typhora.values.push_back(ours);
    raw.peerSamples.values.push_back(rawTransfer(EchoService::emptyCallFrameSize(), bytes, calls) *
                                     1e3);
    if (busClient_ != nullptr) {
      dbus.peerSamples.values.push_back(timePer(calls, [&] { callBus(busClient_, "Answer"); }) *
                                        1e3);
    }
  }
  connection->invalidate();
  device.stop();
  table_.add(std::move(raw));
  table_.add(std::move(dbus));
}

void Comparison::nameResolution() {
  constexpr int kFonts = 10'000;
  if (!corpus_) corpus_ = std::make_unique<FontCorpus>(kFonts);
  BenchDevice& device = this->device(kFonts);
  LinuxPlatform platform(device.root(), device.runtimeDir() + "-inproc");
  TyphoraDaemon daemon(platform.bundle());
  // Ten names: known families (one disabled), known PostScript names, unknown names.
  ValueArray requests;
  for (int i : {1, 7, 4242, 9999}) {
    requests.push_back(
        Value::dictionary({{kSVFontFamilyNameAttribute, "Family " + std::to_string(i)}}));
  }
  for (int i : {12, 5003, 8888}) {
    requests.push_back(
        Value::dictionary({{kSVFontNameAttribute, "Family" + std::to_string(i) + "-Style0"}}));
  }
  for (const char* unknown : {"Nowhere Sans", "Missing Serif", "Absent Mono"}) {
    requests.push_back(Value::dictionary({{kSVFontFamilyNameAttribute, unknown}}));
  }
  std::vector<std::string> families;
  daemon.unknownFontNamesAndEnabledFamilyNames(&families, nullptr, requests);  // loads the cache
  std::vector<std::string> matched = corpus_ ? corpus_->families() : std::vector<std::string>{};
  matched.resize(std::min<std::size_t>(matched.size(), 7));
  for (const char* unknown : {"Nowhere Sans", "Missing Serif", "Absent Mono"})
    matched.push_back(unknown);
  ComparisonRow row{"name resolution, 10000 fonts", "us/name", {}, "FcFontMatch, 10000 files", {}};
  for (int round = 0; round < options_.rounds; ++round) {
    row.typhora.values.push_back(timePer(20,
                                         [&] {
                                           std::vector<std::string> enabled, disabled;
                                           daemon.unknownFontNamesAndEnabledFamilyNames(
                                               &enabled, &disabled, requests);
                                         }) *
                                 1e6 / static_cast<double>(requests.size()));
    if (corpus_->ready()) {
      std::size_t next = 0;
      row.peerSamples.values.push_back(
          timePer(20, [&] { corpus_->match(matched[next++ % matched.size()]); }) * 1e6);
    }
  }
  table_.add(std::move(row));
}

void Comparison::fanout() {
  constexpr int kFonts = 10'000;
  constexpr int kClients = 1000;
  constexpr int kProcesses = 5;  // a user may hold only 256 connections
  BenchDevice& device = this->device(kFonts);
  if (!device.start()) return;
  LumoService service(device.runtimeDir());
  auto connection = device.connect(service);
  bench::checkIn(connection);
  // As long as after the crowd below: the heap trim gives back the first answer's copies alike.
  std::this_thread::sleep_for(std::chrono::seconds(6));
  const long before = procStatusField(device.pid(), "VmRSS:");
  FanoutCrowd crowd(device.runtimeDir(), kClients, kProcesses);
  if (!crowd.ready()) {
    std::fprintf(stderr, "compare: the fan-out clients did not check in\n");
    device.stop();
    return;
  }
  std::this_thread::sleep_for(std::chrono::seconds(6));  // idle pool workers leave
  const long after = procStatusField(device.pid(), "VmRSS:");
  const long threads = procStatusField(device.pid(), "Threads:");
  char line[200];
  std::snprintf(line, sizeof line,
                "daemon with %d fonts and %d checked-in connections: RSS %.1f MB, %ld threads, "
                "%.1f KB per connection",
                kFonts, kClients, static_cast<double>(after) / 1024.0, threads,
                static_cast<double>(after - before) / kClients);
  memory_.push_back(line);
  const Value change =
      Value::dictionary({{"added", true},
                         {"urls", Value::array({"file:///var/mobile/Library/UserFonts/FontFiles/"
                                                "com.example.provider1/Family1.otf"})}});
  auto proxy = connection->synchronousRemoteObjectProxy([](const std::string&) {});
  // One round: the change's time to the last client, and the raw sockets' for the same frames.
  auto round = [&](ComparisonRow& row) {
    const auto start = Clock::now();
    proxy->call(op::kFontChanged, {change}, [](std::vector<Value>) {});
    std::int64_t last = 0;
    std::size_t bytes = 0;
    if (!crowd.awaitRound(&last, &bytes)) {
      std::fprintf(stderr, "compare: a fan-out round went unanswered\n");
      return false;
    }
    const Clock::time_point end{Clock::duration(last)};
    row.typhora.values.push_back(std::chrono::duration<double>(end - start).count() * 1e3);
    // The frame adds its header and the operation's name to the arguments.
    const std::size_t frame = bytes + std::strlen(op::kFontAddedInfo) + 16;
    row.peerSamples.values.push_back(rawFanout(kClients, kProcesses, frame) * 1e3);
    return true;
  };
  // The registry's notification with the file as it was: the daemon need not decode it again.
  ComparisonRow unchanged{"fan-out to 1000 clients", "ms/change", {}, "1000 raw socket writes", {}};
  for (int i = 0; i < options_.rounds && round(unchanged); ++i) {
  }
  // The file written anew before each notification (same bytes, new file): decoded every time.
  ComparisonRow rewritten{"fan-out, file rewritten", "ms/change", {}, "1000 raw socket writes", {}};
  for (int i = 0; i < options_.rounds && device.rewriteUserFonts() && round(rewritten); ++i) {
  }
  connection->invalidate();
  device.stop();
  table_.add(std::move(unchanged));
  table_.add(std::move(rewritten));
}

void Comparison::coldStart() {
  constexpr int kFonts = 10'000;
  if (!corpus_) corpus_ = std::make_unique<FontCorpus>(kFonts);
  BenchDevice& device = this->device(kFonts);
  ComparisonRow row{"cold start to first check-in", "ms", {}, "fc-list, 10000 files", {}};
  for (int round = 0; round < options_.rounds; ++round) {
    LumoService service(device.runtimeDir());
    const auto start = Clock::now();
    device.spawn();
    const std::string socket = device.runtimeDir() + "/" + kServiceName;
    bool answered = false;
    for (int attempt = 0; attempt < 20'000 && !answered; ++attempt) {
      if (access(socket.c_str(), F_OK) == 0) {
        answered = !bench::checkIn(device.connect(service)).isNull();
      }
      if (!answered) std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    const double elapsed = secondsSince(start);
    device.stop();
    if (!answered) break;
    row.typhora.values.push_back(elapsed * 1e3);
    if (corpus_->ready()) row.peerSamples.values.push_back(corpus_->timeFcList() * 1e3);
  }
  table_.add(std::move(row));
}

int Comparison::run() {
  setLogLevel(LogLevel::Error);
  if (options_.withBus) bus_ = std::make_unique<PrivateBus>();
  if (bus_ && bus_->ready()) {
    busServer_ = std::make_unique<BusServer>(*bus_);
    busClient_ = busServer_->ready() ? bus_->connect() : nullptr;
  }
  if (busClient_ == nullptr) std::fprintf(stderr, "compare: no private D-Bus; its rows stay 0\n");
  const std::string before = loadAverage();
  if (wanted("empty-call")) emptyCall();
  if (wanted("checkin")) {
    checkIn(1000);
    checkIn(10'000);
  }
  if (wanted("names")) nameResolution();
  if (wanted("fanout")) fanout();
  if (wanted("cold-start")) coldStart();
  table_.print(std::to_string(options_.rounds) + " rounds; " + before + " at the start, " +
               loadAverage() + " at the end.");
  for (const std::string& line : memory_) std::printf("%s\n", line.c_str());
  if (busClient_ != nullptr) sd_bus_flush_close_unref(busClient_);
  return 0;
}

}  // namespace
}  // namespace typhora::bench

namespace {

constexpr const char* kStrippedMark = "TYPHORA_COMPARE_STRIPPED";

// The daemon reads the digest of an application's program at its first check-in after a start.
// This program is the application of every check-in here, and its build with debug information
// is some 40 MB, far past an application's size: it runs as a copy without that information.
void runStripped(char** argv) {
  if (std::getenv(kStrippedMark) != nullptr) return;
  char pattern[] = "/tmp/typhora-compare-app-XXXXXX";
  if (mkdtemp(pattern) == nullptr) return;
  const std::string copy = std::string(pattern) + "/compare";
  const std::string self = std::filesystem::canonical("/proc/self/exe").string();
  const std::string command = "strip --strip-debug -o '" + copy + "' '" + self + "'";
  if (std::system(command.c_str()) != 0) return;
  setenv(kStrippedMark, pattern, 1);
  execv(copy.c_str(), argv);
}

// Removes the stripped copy once the run is over (its children are gone by then).
void removeStrippedCopy() {
  if (const char* dir = std::getenv(kStrippedMark)) {
    std::error_code ec;
    std::filesystem::remove_all(dir, ec);
  }
}

}  // namespace

int main(int argc, char** argv) {
  using namespace typhora::bench;
  if (argc == 5 && std::strcmp(argv[1], "--fanout-client") == 0) {
    runFanoutClient(argv[2], std::atoi(argv[3]), static_cast<uid_t>(std::atoi(argv[4])));
  }
  Options options;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--rounds" && i + 1 < argc) {
      options.rounds = std::max(1, std::atoi(argv[++i]));
    } else if (arg == "--without-bus") {
      options.withBus = false;
    } else if (arg == "--only" && i + 1 < argc) {
      options.only = argv[++i];
    } else {
      std::fputs(kUsage, arg == "--help" ? stdout : stderr);
      return arg == "--help" ? 0 : 2;
    }
  }
  runStripped(argv);
  const int status = Comparison(std::move(options)).run();
  removeStrippedCopy();
  return status;
}
