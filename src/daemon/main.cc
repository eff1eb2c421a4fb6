// typhorad: the font access daemon. Builds the Linux platform, starts the daemon in its fixed
// order and hands the main thread to the main queue for good.
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "daemon/typhora_daemon.h"
#include "platform/linux/events/event_socket_protocol.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/heap_reserve.h"
#include "platform/linux/heap_trimmer.h"
#include "platform/linux/linux_platform.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/log/log.h"

namespace {

constexpr const char* kUsage =
    "usage: typhorad [--root DIR] [--runtime-dir DIR] [--log-level debug|info|error]\n"
    "                [--log-target stderr|journal]\n"
    "       typhorad --version\n"
    "\n"
    "  --root DIR         device root under which every path of the daemon lives\n"
    "                     (default " TYPHORA_DEFAULT_ROOT
    ")\n"
    "  --runtime-dir DIR  where the service socket is made (default $RUNTIME_DIRECTORY,\n"
    "                     else /run/typhora); ignored under systemd socket activation\n"
    "  --log-level L      lowest level logged (default info)\n"
    "  --log-target T     stderr, or the journal (default: journal when started by systemd)\n";

struct Options {
  std::string root = TYPHORA_DEFAULT_ROOT;
  std::string runtimeDir;
  typhora::LogLevel level = typhora::LogLevel::Info;
  std::string target;
};

[[noreturn]] void usageError(const std::string& message) {
  std::fprintf(stderr, "typhorad: %s\n%s", message.c_str(), kUsage);
  std::exit(2);
}

bool parseLevel(const std::string& text, typhora::LogLevel* level) {
  if (text == "debug")
    *level = typhora::LogLevel::Debug;
  else if (text == "info")
    *level = typhora::LogLevel::Info;
  else if (text == "error")
    *level = typhora::LogLevel::Error;
  else
    return false;
  return true;
}

Options parseOptions(int argc, char** argv) {
  Options options;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    auto next = [&]() -> std::string {
      if (i + 1 >= argc) usageError(arg + " needs a value");
      return argv[++i];
    };
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage, stdout);
      std::exit(0);
    } else if (arg == "--version") {
      std::puts("typhorad " TYPHORA_VERSION);
      std::exit(0);
    } else if (arg == "--root") {
      options.root = next();
    } else if (arg == "--runtime-dir") {
      options.runtimeDir = next();
    } else if (arg == "--log-level") {
      if (!parseLevel(next(), &options.level)) usageError("unknown log level");
    } else if (arg == "--log-target") {
      options.target = next();
      if (options.target != "stderr" && options.target != "journal") {
        usageError("unknown log target");
      }
    } else {
      usageError("unknown option " + arg);
    }
  }
  if (options.runtimeDir.empty()) {
    const char* fromSystemd = std::getenv("RUNTIME_DIRECTORY");
    options.runtimeDir = fromSystemd != nullptr ? fromSystemd : "/run/typhora";
  }
  if (options.target.empty()) {
    options.target = std::getenv("JOURNAL_STREAM") != nullptr ? "journal" : "stderr";
  }
  return options;
}

// The heap that decoding the user-fonts file at start-up will fill, about four times the file.
std::size_t startUpHeapBytes(const std::string& root) {
  constexpr std::uintmax_t kMaxBytes = 256u << 20;
  std::error_code ec;
  std::uintmax_t size = std::filesystem::file_size(
      typhora::DeviceRoot(root).onDisk(typhora::TyphoraDaemon::userFontsFilePath()), ec);
  return ec ? 0 : static_cast<std::size_t>(std::min(4 * size, kMaxBytes));
}

// Every connection holds descriptors: the soft limit goes up to the hard one, so the
// per-user connection cap, not the descriptor table, is what a crowd of clients meets first.
void raiseDescriptorLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= limit.rlim_max) return;
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
}

}  // namespace

int main(int argc, char** argv) {
  const Options options = parseOptions(argc, argv);
  typhora::HeapReserve::prefault(startUpHeapBytes(options.root));
  std::signal(SIGPIPE, SIG_IGN);
  raiseDescriptorLimit();
  // Clients send small calls; the large answers go out, not in.
  typhora::LumoConnection::setInboundLimits(typhora::LumoLimits::inboundFromClients());
  typhora::setLogLevel(options.level);
  typhora::setLogSink(options.target == "journal" ? typhora::makeJournalLogSink()
                                                  : typhora::makeStderrLogSink());

  // The platform lives as long as the process: nothing is freed at shutdown.
  static typhora::LinuxPlatform platform(options.root, options.runtimeDir);
  typhora::TyphoraDaemon::installPlatform(platform.bundle());
  typhora::TyphoraDaemon& daemon = typhora::TyphoraDaemon::sharedDaemon();
  platform.setReporter([&daemon](const std::string& operation, const typhora::Value& argument) {
    if (operation == typhora::eventop::kStatusReport) return daemon.statusReport();
    const std::string* identifier = argument.asString();
    return daemon.grantsReport(identifier != nullptr ? std::optional(*identifier) : std::nullopt);
  });
  // The event socket opens after the service socket, which so keeps a lone unnamed activated
  // socket. An event that started the daemon waits in the socket's backlog until then, and in its
  // launch event stream until the daemon's handler is installed.
  if (!daemon.startUp() || !platform.startServices()) {
    // Threads already run: leave at once, without tearing down what they use.
    std::fprintf(stderr, "typhorad: cannot open its sockets in runtime directory %s\n",
                 options.runtimeDir.c_str());
    std::fflush(stderr);
    std::_Exit(EXIT_FAILURE);
  }
  // After start-up, whose reserved heap is in use by then: bursts of clients leave free pages.
  typhora::HeapTrimmer::start(std::chrono::seconds(5), 8u << 20);
  typhora::SystemLog("typhorad ready: device root %s, runtime directory %s", options.root,
                     options.runtimeDir);
  daemon.run();
}
