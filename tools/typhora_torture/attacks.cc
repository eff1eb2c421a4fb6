#include "attacks.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/eventfd.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <filesystem>
#include <random>
#include <set>
#include <thread>

#include "ipc/interface_descriptions.h"
#include "platform/value/value_codec.h"
#include "support/raw_lumo_attacks.h"

extern char** environ;

namespace typhora::torture {

namespace {

using Bytes = std::vector<std::uint8_t>;
using Clock = std::chrono::steady_clock;

bool timeLeft(const AttackContext& c) {
  return Clock::now() < c.until;
}

// A CBOR item head: major type and argument.
void cborHead(Bytes* out, int major, std::uint64_t value) {
  const auto m = static_cast<std::uint8_t>(major << 5);
  if (value < 24) {
    out->push_back(static_cast<std::uint8_t>(m | value));
    return;
  }
  int size = value <= 0xff ? 1 : value <= 0xffff ? 2 : value <= 0xffffffffULL ? 4 : 8;
  out->push_back(static_cast<std::uint8_t>(m | (size == 1   ? 24
                                                : size == 2 ? 25
                                                : size == 4 ? 26
                                                            : 27)));
  for (int i = size - 1; i >= 0; --i) out->push_back(static_cast<std::uint8_t>(value >> (8 * i)));
}

void cborText(Bytes* out, const std::string& text) {
  cborHead(out, 3, text.size());
  out->insert(out->end(), text.begin(), text.end());
}

// An invocation payload whose values are given as raw CBOR.
Bytes invokeWith(const std::string& op, const Bytes& rawValues, std::size_t valueCount) {
  Bytes out;
  cborHead(&out, 4, 4);
  cborHead(&out, 0, 0);  // Invoke
  cborHead(&out, 0, 7);
  cborText(&out, op);
  cborHead(&out, 4, valueCount);
  out.insert(out.end(), rawValues.begin(), rawValues.end());
  return out;
}

// One malformed frame of kind `k` (cycling through every kind).
Bytes malformedFrame(std::size_t k, std::mt19937& rng) {
  Bytes values;
  switch (k % 10) {
    case 0: {  // random bytes
      Bytes out(256 + rng() % 4096);
      for (auto& b : out) b = static_cast<std::uint8_t>(rng());
      return out;
    }
    case 1: {  // a truncated header
      Bytes header = raw::headerOf(64);
      header.resize(1 + rng() % (kLumoHeaderSize - 1));
      return header;
    }
    case 2: {  // a length near 2^32
      Bytes out = raw::headerOf(0xFFFFFFFFu - rng() % 64);
      out.resize(out.size() + 4096, 0x84);
      return out;
    }
    case 3: {  // nesting 10,000 deep
      for (int i = 0; i < 10000; ++i) values.push_back(0x81);
      values.push_back(0xF6);
      return raw::frameAround(invokeWith(op::kCheckin, values, 1));
    }
    case 4:  // a string claiming 2^62 bytes
      cborHead(&values, 3, 1ULL << 62);
      values.resize(values.size() + 64, 'x');
      return raw::frameAround(invokeWith(op::kCheckin, values, 1));
    case 5:  // a real string just under the frame limit
      cborText(&values, std::string((1u << 20) - 128, 's'));
      return raw::frameAround(invokeWith(op::kCheckin, values, 1));
    case 6: {  // invalid UTF-8 in the operation and in an argument
      Bytes out = invokeWith(std::string("check\xC3\x28in:"), {0x62, 0xFF, 0xFE}, 1);
      return raw::frameAround(out);
    }
    case 7:  // a date tag around a string, a bignum tag, an unassigned tag
      values = {0xC1, 0x61, 'x', 0xC2, 0x41, 0x01, 0xD9, 0xD9, 0xF7, 0xF6};
      return raw::frameAround(invokeWith(op::kCheckin, values, 3));
    case 8:  // an endpoint tag with no descriptor beside it
      cborHead(&values, 6, kCborEndpointTag);
      cborHead(&values, 0, 0);
      return raw::frameAround(invokeWith(op::kCheckinForBrisvelProcess, values, 1));
    default: {  // a wrong magic
      Bytes out = raw::headerOf(4, 0, 0x12345678);
      out.insert(out.end(), {0x84, 0, 1, 0x60});
      return out;
    }
  }
}

// What a malformed frame of each kind is called in the notes.
constexpr const char* kMalformedKinds[] = {
    "random bytes",        "truncated header", "length near 2^32",
    "nesting 10,000 deep", "2^62-byte string", "1 MiB string",
    "invalid UTF-8",       "wrong tags",       "endpoint without descriptor",
    "wrong magic"};

AttackOutcome malformedFrames(const AttackContext& c) {
  AttackOutcome o;
  std::mt19937 rng(20261124);
  long ended = 0, answered = 0;
  std::set<std::size_t> waiting;
  for (std::size_t k = 0; timeLeft(c); ++k) {
    int fd = raw::connectedAndGreeted(c.socket);
    if (fd < 0) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
      continue;
    }
    raw::writeAll(fd, malformedFrame(k, rng));
    ++o.tries;
    // A truncated header is left to the peer's end; every other frame must end the connection
    // or be answered with an error.
    if (k % 10 != 1) {
      if (raw::answerTo(fd, 7, 500)) {
        ++answered;
      } else if (raw::closedWithinMs(fd, 50)) {
        ++ended;
      } else {
        waiting.insert(k % 10);
      }
    }
    close(fd);
  }
  o.note =
      "connection ended " + std::to_string(ended) + ", error answered " + std::to_string(answered);
  for (std::size_t k : waiting) o.note += "; left waiting on " + std::string(kMalformedKinds[k]);
  return o;
}

// Frames the protocol allows that make no sense to the service.
std::vector<Bytes> misuseFrames(std::uint64_t id) {
  using K = LumoMessage::Kind;
  return {
      raw::messageFrame(K::Invoke, id, "noSuchOperation:", {}),
      raw::messageFrame(K::Invoke, id + 1, op::kCheckin, {Value(std::int64_t{42}), Value("x")}),
      raw::messageFrame(K::Invoke, id + 2, op::kRequestFonts, {Value(std::int64_t{42})}),
      raw::messageFrame(K::Invoke, id + 3, op::kRequestFonts, {}),
      raw::messageFrame(K::Invoke, id + 4, op::kRequestFonts, {Value(ValueArray{})}),
      raw::messageFrame(K::Invoke, 0, op::kScheduleFontFilesDeletion, {}),
      raw::messageFrame(K::Invoke, 0, op::kScheduleFontFilesDeletion, {Value(ValueArray{})}),
      raw::messageFrame(K::Invoke, id + 5, op::kResetIssuedFontsFor, {Value(std::string())}),
      raw::messageFrame(K::Invoke, id + 6, op::kSynchronizeFontAssets, {Value::dictionary({})}),
      raw::messageFrame(K::Invoke, id + 7, op::kFontChanged, {Value(std::int64_t{-1})}),
      raw::messageFrame(K::Reply, id + 999, "", {Value(true)}),
      raw::messageFrame(K::Error, id + 998, "an error for no call", {}),
      raw::messageFrame(K::Hello, 0, "1", {}),
  };
}

AttackOutcome protocolMisuse(const AttackContext& c) {
  AttackOutcome o;
  long reconnects = 0;
  int fd = -1;
  for (std::uint64_t id = 1; timeLeft(c); id += 1000) {
    if (fd < 0) {
      fd = raw::connectedAndGreeted(c.socket);
      ++reconnects;
      if (fd < 0) continue;
    }
    for (const Bytes& frame : misuseFrames(id)) {
      ++o.tries;
      if (!raw::writeAll(fd, frame)) break;
    }
    // A check-in after them all says whether the connection survived the nonsense.
    const bool alive = raw::writeAll(fd, raw::frameOf(op::kCheckin, {}, id + 500)) &&
                       raw::answerTo(fd, id + 500, 2000).has_value();
    if (!alive) {
      close(fd);
      fd = -1;
    }
  }
  if (fd >= 0) close(fd);
  o.note = std::to_string(reconnects) + " connections";
  return o;
}

// Descriptors of every kind: sockets, pipes, directories, devices, eventfds, memfds.
std::vector<int> descriptorZoo(std::size_t count) {
  std::vector<int> fds;
  while (fds.size() < count) {
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) == 0) {
      fds.push_back(pair[0]);
      fds.push_back(pair[1]);
    }
    if (pipe2(pair, O_CLOEXEC) == 0) {
      fds.push_back(pair[0]);
      fds.push_back(pair[1]);
    }
    fds.push_back(open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    fds.push_back(open("/dev/zero", O_RDONLY | O_CLOEXEC));
    fds.push_back(eventfd(0, EFD_CLOEXEC));
    fds.push_back(memfd_create("torture", MFD_CLOEXEC));
  }
  std::erase(fds, -1);
  return fds;
}

// The kernel passes at most 253 descriptors in one message.
constexpr std::size_t kMostPerMessage = 250;

AttackOutcome descriptorFlood(const AttackContext& c) {
  AttackOutcome o;
  std::vector<int> all = descriptorZoo(kMostPerMessage);
  const std::vector<int> zoo(all.begin(), all.begin() + kMostPerMessage);
  long cutOff = 0;
  for (std::uint64_t id = 1; timeLeft(c); ++id) {
    int fd = raw::connectedAndGreeted(c.socket);
    if (fd < 0) continue;
    ++o.tries;
    // A frame that claims a few, one that claims none, and bytes of a frame not yet complete.
    Bytes claimed = raw::frameOf(op::kCheckin, {}, id);
    claimed[8] = 16;
    raw::sendWithDescriptors(fd, claimed, zoo);
    raw::sendWithDescriptors(fd, raw::frameOf(op::kCheckin, {}, id + 1), zoo);
    Bytes partial = raw::headerOf(1000, 16);
    raw::sendWithDescriptors(fd, partial, zoo);
    for (int i = 0; i < 8; ++i) raw::sendWithDescriptors(fd, {0x84}, zoo);
    if (raw::closedWithinMs(fd, 500)) ++cutOff;
    close(fd);
  }
  for (int f : all) close(f);
  o.note = std::to_string(zoo.size()) + " descriptors per message; connection ended on " +
           std::to_string(cutOff);
  return o;
}

AttackOutcome slowReader(const AttackContext& c) {
  AttackOutcome o;
  constexpr int kReaders = 4;
  constexpr std::uint64_t kBatch = 512;
  Bytes batch;
  for (std::uint64_t id = 1; id <= kBatch; ++id) {
    Bytes frame = raw::frameOf(op::kCheckin, {}, id);
    batch.insert(batch.end(), frame.begin(), frame.end());
  }
  const std::size_t frameSize = batch.size() / kBatch;
  std::vector<std::thread> threads;
  std::atomic<long> bytes{0}, ended{0};
  for (int r = 0; r < kReaders; ++r) {
    threads.emplace_back([&] {
      while (timeLeft(c)) {
        int fd = raw::connectedAndGreeted(c.socket);
        if (fd < 0) return;
        fcntl(fd, F_SETFL, O_NONBLOCK);
        bool open = true;
        // Calls written back to back, whole frames only, answers never read.
        for (std::size_t at = 0; open && timeLeft(c);) {
          pollfd p{fd, POLLOUT, 0};
          if (poll(&p, 1, 100) <= 0) continue;
          if (p.revents & (POLLERR | POLLHUP)) {
            open = false;
            break;
          }
          ssize_t n = send(fd, batch.data() + at, batch.size() - at, MSG_NOSIGNAL);
          if (n < 0 && errno != EAGAIN) open = false;
          if (n <= 0) continue;
          bytes += n;
          at = (at + static_cast<std::size_t>(n)) % batch.size();
        }
        if (!open) ++ended;
        close(fd);
      }
    });
  }
  for (auto& t : threads) t.join();
  o.tries = bytes / static_cast<long>(frameSize);
  o.note = std::to_string(kReaders) + " peers never reading; cut off " +
           std::to_string(ended.load()) + " times";
  return o;
}

pid_t spawn(const std::vector<std::string>& args);

// Starts this program as `--child MODE SOCKET ARG`; its pid, or -1.
pid_t spawnChild(const AttackContext& c, const std::string& mode, const std::string& arg) {
  return spawn({c.self, "--child", mode, c.socket, arg});
}

int exitStatus(pid_t pid) {
  int status = 0;
  if (waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// Starts `argv`; its pid, or -1.
pid_t spawn(const std::vector<std::string>& args) {
  std::vector<std::string> copy = args;
  std::vector<char*> argv;
  for (auto& a : copy) argv.push_back(a.data());
  argv.push_back(nullptr);
  // What the attackers print is not the report's.
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  pid_t pid = -1;
  const int failed = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  return failed != 0 ? -1 : pid;
}

AttackOutcome dyingPeers(const AttackContext& c) {
  AttackOutcome o;
  std::mt19937 rng(7);
  // The phases of a raw peer, then (when given) an application with a request in flight.
  const int phases = c.requester.empty() ? 6 : 7;
  long requesters = 0;
  for (int phase = 0; timeLeft(c); phase = (phase + 1) % phases) {
    const bool request = phase == 6;
    pid_t pid = request ? spawn(c.requester) : spawnChild(c, "die", std::to_string(phase));
    if (pid < 0) break;
    ++o.tries;
    requesters += request ? 1 : 0;
    // A requester gets long enough to reach the gate and the dialog.
    const auto delay = request ? std::chrono::microseconds(rng() % 400000)
                               : std::chrono::microseconds(rng() % 20000);
    std::this_thread::sleep_for(delay);
    kill(pid, SIGKILL);
    exitStatus(pid);
  }
  o.note = "killed in 6 phases of a call";
  if (requesters > 0) {
    o.note += ", and " + std::to_string(requesters) + " requesters with the gate or dialog up";
  }
  return o;
}

AttackOutcome connectionStorm(const AttackContext& c) {
  AttackOutcome o;
  long worstRefused = 0, greetedLast = 0;
  while (timeLeft(c)) {
    std::vector<int> fds(static_cast<std::size_t>(c.storm), -1);
    std::atomic<long> greeted{0};
    std::vector<std::thread> threads;
    constexpr int kThreads = 8;
    for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&, t] {
        for (std::size_t i = static_cast<std::size_t>(t); i < fds.size(); i += kThreads) {
          fds[i] = raw::connectTo(c.socket);
        }
        for (std::size_t i = static_cast<std::size_t>(t); i < fds.size(); i += kThreads) {
          if (fds[i] >= 0 && raw::handshake(fds[i]) &&
              raw::writeAll(fds[i], raw::frameOf(op::kCheckin, {}, 1)) &&
              raw::answerTo(fds[i], 1, 5000)) {
            ++greeted;
          }
        }
      });
    }
    for (auto& t : threads) t.join();
    for (int fd : fds) {
      if (fd >= 0) close(fd);
    }
    o.tries += c.storm;
    greetedLast = greeted;
    worstRefused = std::max(worstRefused, c.storm - greeted.load());
  }
  o.note = std::to_string(c.storm) + " at once; answered " + std::to_string(greetedLast) +
           " (the rest over the user's cap); worst refused " + std::to_string(worstRefused);
  return o;
}

AttackOutcome churn(const AttackContext& c) {
  AttackOutcome o;
  std::atomic<long> tries{0}, greeted{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (long i = 0; timeLeft(c); ++i) {
        int fd = raw::connectTo(c.socket);
        if (fd < 0) {
          std::this_thread::sleep_for(std::chrono::milliseconds(10));
          continue;
        }
        ++tries;
        // Alternately a peer that leaves at once and one that leaves after its hello.
        if ((i + t) % 2 == 0 && raw::handshake(fd)) ++greeted;
        close(fd);
      }
    });
  }
  for (auto& t : threads) t.join();
  o.tries = tries;
  o.note = std::to_string(greeted.load()) + " greeted before closing";
  return o;
}

// A copy of this program at another inode: exec'ing it is exec'ing another program.
std::string otherProgram(const AttackContext& c) {
  char pattern[] = "/tmp/typhora-torture-exec-XXXXXX";
  int fd = mkstemp(pattern);
  if (fd < 0) return {};
  close(fd);
  std::error_code ec;
  std::filesystem::copy_file(c.self, pattern, std::filesystem::copy_options::overwrite_existing,
                             ec);
  chmod(pattern, 0755);
  return ec ? std::string() : std::string(pattern);
}

AttackOutcome identityAttacks(const AttackContext& c) {
  AttackOutcome o;
  const std::string other = otherProgram(c);
  const std::vector<std::pair<std::string, std::string>> modes = {
      {"exec-writer", other}, {"fork-writer", ""}, {"before-hello", ""}};
  long errors = 0;
  for (std::size_t i = 0; timeLeft(c); ++i) {
    const auto& [mode, arg] = modes[i % modes.size()];
    pid_t pid = spawnChild(c, mode, arg);
    if (pid < 0) break;
    const int status = exitStatus(pid);
    ++o.tries;
    if (status == 1) ++o.gotThrough;
    if (status != 0 && status != 1) ++errors;
  }
  if (!other.empty()) unlink(other.c_str());
  o.note = "exec of another program, a forked child, a frame before the hello; " +
           std::to_string(errors) + " could not attack";
  return o;
}

// --- child processes ---

int die(const std::string& socket, int phase) {
  int fd = raw::connectTo(socket);
  if (fd < 0) return 2;
  if (phase == 0) return 0;
  if (phase == 1) return raw::readFrame(fd).empty() ? 2 : 0;
  if (!raw::handshake(fd)) return 2;
  if (phase == 2) {
    Bytes frame = raw::frameOf(op::kCheckin, {}, 1);
    frame.resize(frame.size() / 2);
    raw::writeAll(fd, frame);
  } else if (phase == 3) {
    raw::writeAll(fd, raw::frameOf(op::kCheckin, {}, 1));
  } else if (phase == 4) {
    // A request for a family nobody has holds the request gate (and brings up the dialog for an
    // entitled foreground caller) when the caller goes.
    ValueArray requests = {Value::dictionary({{"SVFontFamilyAttribute", "Torture Missing"}})};
    raw::writeAll(fd, raw::frameOf(op::kRequestFonts, {Value(std::move(requests))}, 1));
  } else {
    Bytes batch;
    for (std::uint64_t id = 1; id <= 64; ++id) {
      Bytes frame = raw::frameOf(op::kCheckin, {}, id);
      batch.insert(batch.end(), frame.begin(), frame.end());
    }
    raw::writeAll(fd, batch);
  }
  pause();  // killed by the attacker at a random moment
  return 0;
}

int answeredOrRefused(int fd, std::uint64_t id) {
  return raw::answerTo(fd, id, 3000).has_value() ? 1 : 0;
}

int execWriter(const std::string& socket, const std::string& other) {
  int fd = raw::connectedAndGreeted(socket);
  if (fd < 0 || other.empty()) return 2;
  // The inherited connection, used by another program.
  const std::string fdText = std::to_string(fd);
  fcntl(fd, F_SETFD, 0);
  execl(other.c_str(), other.c_str(), "--child", "write-inherited", socket.c_str(), fdText.c_str(),
        nullptr);
  return 2;
}

int writeInherited(const std::string& fdText) {
  const int fd = std::stoi(fdText);
  if (!raw::writeAll(fd, raw::frameOf(op::kCheckin, {}, 1))) return 0;
  return answeredOrRefused(fd, 1);
}

int forkWriter(const std::string& socket) {
  int fd = raw::connectedAndGreeted(socket);
  if (fd < 0) return 2;
  pid_t child = fork();
  if (child == 0) {
    raw::writeAll(fd, raw::frameOf(op::kCheckin, {}, 1));
    _exit(0);
  }
  const int result = answeredOrRefused(fd, 1);
  waitpid(child, nullptr, 0);
  return result;
}

int beforeHello(const std::string& socket) {
  int fd = raw::connectTo(socket);
  if (fd < 0) return 2;
  if (!raw::writeAll(fd, raw::frameOf(op::kCheckin, {}, 1))) return 0;
  return answeredOrRefused(fd, 1);
}

}  // namespace

std::vector<Attack> allAttacks() {
  return {{"malformed frames", malformedFrames}, {"protocol misuse", protocolMisuse},
          {"descriptor flood", descriptorFlood}, {"peers that never read", slowReader},
          {"peers dying mid-call", dyingPeers},  {"connection storm", connectionStorm},
          {"connect/close churn", churn},        {"identity attacks", identityAttacks},
          {"token attacks", tokenAttacks}};
}

int runChild(const std::string& mode, const std::string& socket, const std::string& arg) {
  if (mode == "die") return die(socket, std::stoi(arg));
  if (mode == "exec-writer") return execWriter(socket, arg);
  if (mode == "write-inherited") return writeInherited(arg);
  if (mode == "fork-writer") return forkWriter(socket);
  if (mode == "before-hello") return beforeHello(socket);
  return 2;
}

}  // namespace typhora::torture
