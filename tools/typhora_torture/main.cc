// typhora-torture: attacks a running typhorad on its service socket, one attack after another,
// while a well-behaved client keeps checking in. Prints one row per attack: tries, whether the
// daemon still served, the client's worst and 99th-percentile latency during the attack, and the
// daemon's resident memory and descriptors before and after. Starts nothing but its own child
// attackers, talks only to the local socket, and stops after the time it is given.
//
// Exits 0 when every row still served and every attack that must be refused was.
#include <sys/resource.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <filesystem>
#include <iostream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "attacks.h"
#include "daemon_gauge.h"
#include "probe_client.h"
#include "support/raw_lumo_client.h"

using namespace typhora::torture;
using namespace std::chrono_literals;

namespace {

constexpr const char* kUsage =
    "usage: typhora-torture [--runtime-dir DIR | --socket PATH] [--pid PID] [--seconds N]\n"
    "                       [--storm N] [--only NAME,...] [--requester COMMAND]\n"
    "                       [--token-app COMMAND] [--json]\n"
    "  --runtime-dir DIR  where the daemon's socket is (default $TYPHORA_RUNTIME_DIR, else\n"
    "                     /run/typhora)\n"
    "  --socket PATH      the service socket itself\n"
    "  --pid PID          the daemon (default: the socket's peer)\n"
    "  --seconds N        how long each attack runs (default 5)\n"
    "  --storm N          connections opened at once by the storm (default 1000)\n"
    "  --only NAMES       run only the attacks whose names contain one of these words\n"
    "  --requester CMD    a command (words split on spaces) that requests a missing font as an\n"
    "                     entitled foreground application; killed with the gate and dialog up\n"
    "  --token-app CMD    a command that checks in as an application holding fonts and prints\n"
    "                     its tokens (`APP sandbox-open --checkin`): the token replayed by the\n"
    "                     token attacks\n"
    "  --json             one JSON object per row instead of the table\n";

struct Options {
  std::string socket;
  pid_t pid = -1;
  double seconds = 5;
  int storm = 1000;
  std::vector<std::string> only;
  bool json = false;
  std::vector<std::string> requester;
  std::vector<std::string> tokenApp;
};

struct Row {
  std::string name;
  AttackOutcome outcome;
  bool serving = false;
  ProbeClient::Window probe;
  long rssBefore = 0, rssAfter = 0, fdsBefore = 0, fdsAfter = 0;
};

bool parse(int argc, char** argv, Options* o) {
  const char* dir = std::getenv("TYPHORA_RUNTIME_DIR");
  o->socket = std::string(dir != nullptr ? dir : "/run/typhora") + "/com.zorvane.typhorad";
  for (int i = 1; i < argc; ++i) {
    const std::string a = argv[i];
    const bool hasValue = i + 1 < argc;
    if (a == "--json") {
      o->json = true;
    } else if (a == "--runtime-dir" && hasValue) {
      o->socket = std::string(argv[++i]) + "/com.zorvane.typhorad";
    } else if (a == "--socket" && hasValue) {
      o->socket = argv[++i];
    } else if (a == "--pid" && hasValue) {
      o->pid = std::stoi(argv[++i]);
    } else if (a == "--seconds" && hasValue) {
      o->seconds = std::stod(argv[++i]);
    } else if (a == "--storm" && hasValue) {
      o->storm = std::stoi(argv[++i]);
    } else if (a == "--requester" && hasValue) {
      std::istringstream words(argv[++i]);
      for (std::string w; words >> w;) o->requester.push_back(w);
    } else if (a == "--token-app" && hasValue) {
      std::istringstream words(argv[++i]);
      for (std::string w; words >> w;) o->tokenApp.push_back(w);
    } else if (a == "--only" && hasValue) {
      std::string list = argv[++i];
      for (std::size_t at = 0; at <= list.size();) {
        std::size_t comma = std::min(list.find(',', at), list.size());
        o->only.push_back(list.substr(at, comma - at));
        at = comma + 1;
      }
    } else {
      return false;
    }
  }
  return o->seconds > 0 && o->storm > 0;
}

bool selected(const Options& o, const std::string& name) {
  if (o.only.empty()) return true;
  for (const auto& word : o.only) {
    if (!word.empty() && name.find(word) != std::string::npos) return true;
  }
  return false;
}

// A fresh connection's check-in is answered.
bool freshCheckin(const std::string& socket) {
  for (int attempt = 0; attempt < 3; ++attempt) {
    int fd = typhora::raw::connectTo(socket);
    if (fd >= 0 && typhora::raw::handshake(fd) &&
        typhora::raw::writeAll(fd, typhora::raw::frameOf("checkin:", {}, 1)) &&
        typhora::raw::answerTo(fd, 1, 5000)) {
      close(fd);
      return true;
    }
    if (fd >= 0) close(fd);
    std::this_thread::sleep_for(200ms);
  }
  return false;
}

// The attackers' connections take a moment to be torn down: waits until the descriptors are
// back near `baseline`, for at most ten seconds.
long settledDescriptors(const DaemonGauge& gauge, long baseline) {
  long now = gauge.descriptors();
  for (int i = 0; i < 100 && now > baseline + 2; ++i) {
    std::this_thread::sleep_for(100ms);
    now = gauge.descriptors();
  }
  return now;
}

// The daemon's resident memory once the attackers are gone: what it keeps of what they made it
// allocate. Waits up to twenty seconds for it to come back near `baselineKb`.
long settledRssKb(const DaemonGauge& gauge, long baselineKb) {
  long now = gauge.rssKb();
  for (int i = 0; i < 200 && now > baselineKb + 8 * 1024; ++i) {
    std::this_thread::sleep_for(100ms);
    now = gauge.rssKb();
  }
  return now;
}

void printSettled(long rssBaseline, long rssAfter, long fdsBaseline, long fdsAfter, bool json) {
  if (json) {
    std::printf("{\"settled\":{\"rssKb\":[%ld,%ld],\"descriptors\":[%ld,%ld]}}\n", rssBaseline,
                rssAfter, fdsBaseline, fdsAfter);
  } else {
    std::printf("after the attackers left: RSS %ld -> %ld kB, descriptors %ld -> %ld\n",
                rssBaseline, rssAfter, fdsBaseline, fdsAfter);
  }
  std::fflush(stdout);
}

void printRow(const Row& r, bool json) {
  const AttackOutcome& o = r.outcome;
  if (json) {
    std::printf(
        "{\"attack\":\"%s\",\"tries\":%ld,\"gotThrough\":%ld,\"serving\":%s,\"probeCalls\":%zu,"
        "\"probeFailures\":%zu,\"worstMs\":%.1f,\"p99Ms\":%.1f,\"rssKb\":[%ld,%ld],"
        "\"descriptors\":[%ld,%ld],\"note\":\"%s\"}\n",
        r.name.c_str(), o.tries, o.gotThrough, r.serving ? "true" : "false", r.probe.calls,
        r.probe.failures, r.probe.worstMs, r.probe.p99Ms, r.rssBefore, r.rssAfter, r.fdsBefore,
        r.fdsAfter, o.note.c_str());
  } else {
    std::printf(
        "| %-22s | %8ld | %-7s | %8.1f | %8.1f | %6ld -> %6ld | %4ld -> %4ld | %s%s |\n",
        r.name.c_str(), o.tries, r.serving ? "yes" : "NO", r.probe.worstMs, r.probe.p99Ms,
        r.rssBefore, r.rssAfter, r.fdsBefore, r.fdsAfter,
        o.gotThrough > 0 ? ("GOT THROUGH " + std::to_string(o.gotThrough) + "; ").c_str() : "",
        o.note.c_str());
  }
  std::fflush(stdout);
}

void raiseDescriptorLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < limit.rlim_max) {
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
  }
}

}  // namespace

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  if (argc >= 4 && std::string(argv[1]) == "--child") {
    return runChild(argv[2], argv[3], argc > 4 ? argv[4] : "");
  }
  Options options;
  if (!parse(argc, argv, &options)) {
    std::cerr << kUsage;
    return 2;
  }
  raiseDescriptorLimit();
  if (options.pid < 0) options.pid = DaemonGauge::pidListeningOn(options.socket);
  if (options.pid < 0) {
    std::cerr << "typhora-torture: no daemon answers on " << options.socket << "\n";
    return 2;
  }
  const DaemonGauge gauge(options.pid);
  AttackContext context{options.socket,   std::filesystem::read_symlink("/proc/self/exe"),
                        options.storm,    options.requester,
                        options.tokenApp, {}};

  ProbeClient probe(options.socket, 20ms);
  probe.start();
  if (!options.json) {
    std::printf("daemon pid %d on %s, %.0f s per attack\n", options.pid, options.socket.c_str(),
                options.seconds);
    std::printf("| %-22s | %8s | %-7s | %8s | %8s | %-16s | %-12s | %s |\n", "attack", "tries",
                "serving", "worst ms", "p99 ms", "RSS kB", "descriptors", "notes");
  }
  bool allHeld = true;
  const long rssBaseline = gauge.rssKb();
  const long fdsBaseline = gauge.descriptors();
  for (const Attack& attack : allAttacks()) {
    if (!selected(options, attack.name)) continue;
    Row row;
    row.name = attack.name;
    row.rssBefore = gauge.rssKb();
    row.fdsBefore = gauge.descriptors();
    const auto from = ProbeClient::Clock::now();
    context.until = from + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                               std::chrono::duration<double>(options.seconds));
    row.outcome = attack.run(context);
    row.fdsAfter = settledDescriptors(gauge, row.fdsBefore);
    row.probe = probe.window(from, ProbeClient::Clock::now());
    row.serving = gauge.alive() && row.probe.failures == 0 && freshCheckin(options.socket);
    row.rssAfter = gauge.rssKb();
    printRow(row, options.json);
    allHeld = allHeld && row.serving && row.outcome.gotThrough == 0;
    if (!gauge.alive()) break;
  }
  probe.stop();
  if (gauge.alive()) {
    const long fds = settledDescriptors(gauge, fdsBaseline);
    printSettled(rssBaseline, settledRssKb(gauge, rssBaseline), fdsBaseline, fds, options.json);
  }
  return allHeld ? 0 : 1;
}
