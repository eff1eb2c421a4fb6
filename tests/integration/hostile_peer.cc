// A hostile local client of the daemon, speaking the wire protocol by hand. Each mode is one
// attack; it prints what it saw on standard output. The modes that hold connections print once
// the attack is in place and hold them until the process is killed.
//   pipeline SOCKET SECONDS   pipelines updatingUserFonts: calls as fast as it can
//   big-frame SOCKET          one frame of four million one-byte items
//   before-hello SOCKET       a checkin: written before the daemon's hello is read
//   fork-writer SOCKET        after the handshake, a forked child writes the checkin:
//   hold-fds SOCKET           an unfinished frame that keeps collecting descriptors
//   partial SOCKET N          N connections, each holding an unfinished frame just under 1 MiB
//   connections SOCKET N      N connections that finish the handshake and stay idle
//   silent SOCKET N           N connections that never answer the hello
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <iostream>
#include <string>
#include <thread>
#include <vector>

#include "support/raw_lumo_attacks.h"

using namespace typhora;

namespace {

[[noreturn]] void holdUntilKilled() {
  for (;;) pause();
}

bool closedWithin(int fd, int seconds) {
  return raw::closedWithinMs(fd, seconds * 1000);
}

int connectedAndGreeted(const std::string& socket) {
  return raw::connectedAndGreeted(socket);
}

int pipeline(const std::string& socket, int seconds) {
  int fd = connectedAndGreeted(socket);
  if (fd < 0) return 1;
  std::atomic<bool> stop{false};
  std::thread drain([&] {
    std::uint8_t buffer[65536];
    while (!stop) {
      pollfd p{fd, POLLIN, 0};
      if (poll(&p, 1, 100) > 0 && recv(fd, buffer, sizeof buffer, 0) <= 0) return;
    }
  });
  std::vector<std::uint8_t> batch;
  for (std::uint64_t id = 1; id <= 256; ++id) {
    auto frame = raw::frameOf("updatingUserFonts:", {}, id);
    batch.insert(batch.end(), frame.begin(), frame.end());
  }
  std::uint64_t sent = 0;
  const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
  while (std::chrono::steady_clock::now() < until && raw::writeAll(fd, batch)) sent += 256;
  stop = true;
  drain.join();
  std::cout << "sent " << sent << std::endl;
  return 0;
}

int bigFrame(const std::string& socket) {
  int fd = connectedAndGreeted(socket);
  if (fd < 0) return 1;
  ValueArray items(4'000'000, Value(std::int64_t{1}));
  auto frame = raw::frameOf("scheduleFontFilesDeletion:", {Value(std::move(items))}, 0);
  std::thread writer([&] { raw::writeAll(fd, frame); });
  const bool closed = closedWithin(fd, 20);
  shutdown(fd, SHUT_RDWR);
  writer.join();
  std::cout << (closed ? "closed" : "open") << std::endl;
  return 0;
}

int beforeHello(const std::string& socket) {
  int fd = raw::connectTo(socket);
  if (fd < 0) return 1;
  if (!raw::writeAll(fd, raw::frameOf("checkin:", {}, 1))) return 1;
  const bool answered = raw::answerTo(fd, 1).has_value();
  std::cout << (answered ? "answered" : "refused") << std::endl;
  return 0;
}

int forkWriter(const std::string& socket) {
  int fd = connectedAndGreeted(socket);
  if (fd < 0) return 1;
  pid_t child = fork();
  if (child == 0) {
    raw::writeAll(fd, raw::frameOf("checkin:", {}, 1));
    _exit(0);
  }
  const bool answered = raw::answerTo(fd, 1, 5000).has_value();
  waitpid(child, nullptr, 0);
  std::cout << (answered ? "answered" : "refused") << std::endl;
  return 0;
}

int holdFds(const std::string& socket) {
  int fd = connectedAndGreeted(socket);
  if (fd < 0) return 1;
  // A header announcing 16 descriptors and a payload that never completes; each further byte
  // brings 16 more descriptors.
  std::vector<std::uint8_t> header = raw::frameOf("note:", {Value(std::string(4000, 'x'))}, 0);
  header.resize(kLumoHeaderSize + 1);
  int sent = 0;
  for (int round = 0; round < 16; ++round) {
    std::vector<int> fds;
    for (int i = 0; i < 16; ++i) fds.push_back(open("/dev/null", O_RDONLY | O_CLOEXEC));
    std::vector<std::uint8_t> bytes =
        round == 0 ? header : std::vector<std::uint8_t>{static_cast<std::uint8_t>('x')};
    const bool ok = raw::sendWithDescriptors(fd, bytes, fds);
    for (int f : fds) close(f);
    if (!ok) break;
    sent += 16;
  }
  std::cout << "sent " << sent << " descriptors; " << (closedWithin(fd, 10) ? "closed" : "open")
            << std::endl;
  return 0;
}

int partial(const std::string& socket, int count) {
  std::vector<int> fds;
  std::vector<std::uint8_t> frame =
      raw::frameOf("note:", {Value(std::string((1u << 20) - 64, 'p'))}, 0);
  frame.pop_back();  // never finished
  for (int i = 0; i < count; ++i) {
    int fd = connectedAndGreeted(socket);
    if (fd < 0 || !raw::writeAll(fd, frame)) break;
    fds.push_back(fd);
  }
  std::cout << "holding " << fds.size() << std::endl;
  holdUntilKilled();
}

int idleConnections(const std::string& socket, int count, bool greet) {
  std::vector<int> fds;
  int greeted = 0;
  for (int i = 0; i < count; ++i) {
    int fd = raw::connectTo(socket);
    if (fd < 0) break;
    fds.push_back(fd);
    if (greet) greeted += raw::handshake(fd) ? 1 : 0;
  }
  std::cout << "opened " << fds.size() << " greeted " << greeted << std::endl;
  holdUntilKilled();
}

}  // namespace

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  if (argc < 3) return 2;
  const std::string mode = argv[1];
  const std::string socket = argv[2];
  const int n = argc > 3 ? std::stoi(argv[3]) : 0;
  if (mode == "pipeline") return pipeline(socket, n);
  if (mode == "big-frame") return bigFrame(socket);
  if (mode == "before-hello") return beforeHello(socket);
  if (mode == "fork-writer") return forkWriter(socket);
  if (mode == "hold-fds") return holdFds(socket);
  if (mode == "partial") return partial(socket, n);
  if (mode == "connections") return idleConnections(socket, n, true);
  if (mode == "silent") return idleConnections(socket, n, false);
  return 2;
}
