// The daemon's side of the token exchange: a sandboxed application that holds a read-only
// extension token gets a descriptor of exactly the file or directory the token names, opened by
// the daemon beneath the device root, read-only.
//
// The peer is pinned when it connects (SO_PEERCRED, its pidfd, start time and executable); the
// message must be written by that same process (its SCM_CREDENTIALS), and the token must have
// been issued to that process instance. A forked child, a process the socket was handed to, or
// a later process of the same program cannot use it.
//
// Served on a small thread of its own with an epoll loop over non-blocking sockets, not on the
// IPC's I/O thread: each exchange reads the peer's /proc entries and opens a file, bounded work
// but file system calls that the I/O thread, serving every connection, should not wait for.
// Nothing a client does blocks the thread: reads and writes never wait, a connection ends after
// one exchange, silent ones are cut off after a timeout, and connections are capped per user
// and in all.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <thread>
#include <utility>

#include "platform/fd/unique_fd.h"
#include "platform/linux/identity/process_pin.h"
#include "platform/linux/sandbox/linux_sandbox_broker.h"

namespace typhora {

struct SandboxExchangeLimits {
  std::size_t connections = 128;
  std::size_t connectionsPerUser = 16;
  std::chrono::milliseconds silentPeer{5000};
};

class SandboxExtensionServer {
 public:
  using Limits = SandboxExchangeLimits;

  SandboxExtensionServer(std::string root, std::string runtimeDir, const LinuxSandboxBroker& broker,
                         Limits limits = {});
  ~SandboxExtensionServer();
  SandboxExtensionServer(const SandboxExtensionServer&) = delete;
  SandboxExtensionServer& operator=(const SandboxExtensionServer&) = delete;

  // Listens on the socket systemd hands over by that name, else on <runtimeDir>/<name> (mode
  // 0666: every application must reach it), and starts serving; false when it cannot (logged).
  bool start();

 private:
  using Clock = std::chrono::steady_clock;
  struct Connection {
    UniqueFd fd;
    ProcessPin pin;
    uid_t uid = 0;
    Clock::time_point deadline;
  };

  void run();
  void acceptAll();
  void serve(int fd);
  void sweep();
  void close(int fd);
  void watchListener(bool watch);
  // The answer for `token` from `connection`'s peer; `opened` gets the descriptor on success.
  std::string exchange(const Connection& connection, std::string token, UniqueFd* opened) const;
  UniqueFd openBeneathRoot(const std::string& path, std::string* kind) const;
  // `entry` (plain relative components) beneath the open `directory`, read-only.
  static UniqueFd openEntry(int directory, const std::string& entry, std::string* kind);
  static bool isPlainRelativePath(const std::string& path);
  void refuse(const Connection& connection, const std::string& reason);

  DeviceRoot root_;
  std::string runtimeDir_;
  UniqueFd rootFd_;
  const LinuxSandboxBroker& broker_;
  Limits limits_;
  UniqueFd listener_;
  UniqueFd epoll_;
  UniqueFd wake_;
  bool listening_ = false;
  Clock::time_point acceptPausedUntil_;
  std::map<int, Connection> connections_;
  std::map<uid_t, std::size_t> perUser_;
  // Peers (pid, start time) whose refusal was logged; cleared when it grows large.
  std::set<std::pair<pid_t, std::uint64_t>> refusalsLogged_;
  std::thread thread_;
};

}  // namespace typhora
