#include "platform/linux/sandbox/sandbox_extension_server.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <vector>

#include "platform/linux/files/device_root.h"
#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/linux/sandbox/rooted_open.h"
#include "platform/linux/sandbox/sandbox_extension_protocol.h"
#include "platform/linux/unix_socket_file.h"
#include "platform/log/log.h"

namespace typhora {
namespace {

constexpr std::size_t kMaxLoggedPeers = 4096;
constexpr auto kTick = std::chrono::milliseconds(100);
// Out of descriptors: accepting waits this long before it tries again.
constexpr auto kAcceptBackoff = std::chrono::milliseconds(100);

void sendAnswer(int fd, const std::string& text, int descriptor) {
  iovec part{const_cast<char*>(text.data()), text.size()};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  std::vector<char> control;
  if (descriptor >= 0) attachDescriptors(&message, &control, {descriptor});
  // A fresh connection's buffer takes one short answer; a peer that made it fail gets nothing.
  (void)sendmsg(fd, &message, MSG_DONTWAIT | MSG_NOSIGNAL);
}

}  // namespace

SandboxExtensionServer::SandboxExtensionServer(std::string root, std::string runtimeDir,
                                               const LinuxSandboxBroker& broker, Limits limits)
    : root_(std::move(root)),
      runtimeDir_(std::move(runtimeDir)),
      broker_(broker),
      limits_(limits) {}

SandboxExtensionServer::~SandboxExtensionServer() {
  if (!thread_.joinable()) return;
  const std::uint64_t one = 1;
  (void)write(wake_.get(), &one, sizeof one);
  thread_.join();
}

bool SandboxExtensionServer::start() {
  rootFd_.reset(open(root_.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  std::string error;
  listener_ = UnixSocketFile::activated(sandboxexchange::kSocketName);
  if (!listener_.valid()) {
    listener_ = UnixSocketFile::bindListening(runtimeDir_ + "/" + sandboxexchange::kSocketName,
                                              SOCK_SEQPACKET, 0666, &error);
  }
  epoll_.reset(epoll_create1(EPOLL_CLOEXEC));
  wake_.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!rootFd_.valid() || !listener_.valid() || !epoll_.valid() || !wake_.valid()) {
    SystemLog("sandbox socket: cannot start: %@", error.empty() ? std::strerror(errno) : error);
    return false;
  }
  // Accepted sockets inherit it: every message carries its writer's credentials.
  const int on = 1;
  setsockopt(listener_.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.fd = wake_.get();
  epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, wake_.get(), &event);
  watchListener(true);
  thread_ = std::thread([this] { run(); });
  return true;
}

void SandboxExtensionServer::watchListener(bool watch) {
  if (watch == listening_) return;
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.fd = listener_.get();
  epoll_ctl(epoll_.get(), watch ? EPOLL_CTL_ADD : EPOLL_CTL_DEL, listener_.get(), &event);
  listening_ = watch;
}

void SandboxExtensionServer::run() {
  std::array<epoll_event, 64> events{};
  for (;;) {
    const int count =
        epoll_wait(epoll_.get(), events.data(), events.size(), static_cast<int>(kTick.count()));
    for (int i = 0; i < count; ++i) {
      const int fd = events[i].data.fd;
      if (fd == wake_.get()) return;
      if (fd == listener_.get()) {
        acceptAll();
      } else {
        serve(fd);
      }
    }
    sweep();
  }
}

void SandboxExtensionServer::acceptAll() {
  while (connections_.size() < limits_.connections) {
    UniqueFd fd(accept4(listener_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!fd.valid()) {
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        acceptPausedUntil_ = Clock::now() + kAcceptBackoff;
        watchListener(false);
      }
      return;
    }
    ucred cred{};
    socklen_t length = sizeof cred;
    getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &cred, &length);
    std::size_t& held = perUser_[cred.uid];
    if (held >= limits_.connectionsPerUser) continue;  // closed: this user holds enough open
    ++held;
    Connection connection;
    connection.uid = cred.uid;
    connection.pin = ProcessPin::ofSocketPeer(fd.get());
    connection.deadline = Clock::now() + limits_.silentPeer;
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = fd.get();
    epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, fd.get(), &event);
    connection.fd = std::move(fd);
    const int key = connection.fd.get();
    connections_.emplace(key, std::move(connection));
  }
  // At the cap: the kernel's backlog holds the rest until an exchange ends.
  watchListener(false);
}

void SandboxExtensionServer::sweep() {
  const Clock::time_point now = Clock::now();
  std::vector<int> late;
  for (const auto& [fd, connection] : connections_)
    if (connection.deadline <= now) late.push_back(fd);
  for (int fd : late) close(fd);
  if (!listening_ && connections_.size() < limits_.connections && now >= acceptPausedUntil_)
    watchListener(true);
}

void SandboxExtensionServer::close(int fd) {
  auto it = connections_.find(fd);
  if (it == connections_.end()) return;
  epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, fd, nullptr);
  auto held = perUser_.find(it->second.uid);
  if (held != perUser_.end() && --held->second == 0) perUser_.erase(held);
  connections_.erase(it);
}

void SandboxExtensionServer::serve(int fd) {
  auto it = connections_.find(fd);
  if (it == connections_.end()) return;
  Connection& connection = it->second;
  std::string token(sandboxexchange::kMaxTokenSize, '\0');
  iovec part{token.data(), token.size()};
  // Room for the credentials and a few descriptors a client may push at the daemon.
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(ucred)) + CMSG_SPACE(sizeof(int) * 16)>
      control{};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const ssize_t n = recvmsg(fd, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (n < 0 && (errno == EAGAIN || errno == EINTR)) return;
  // Closed: the exchange takes none (an empty message may carry some too).
  if (n >= 0) takeDescriptors(&message);
  if (n <= 0) {
    close(fd);
    return;
  }
  token.resize(static_cast<std::size_t>(n));
  std::string refusal;
  const std::optional<ucred> writer = takeCredentials(&message);
  if ((message.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) != 0) {
    refusal = "message too long";
  } else if (!connection.pin.pinned()) {
    refusal = "the connecting process cannot be identified";
  } else if (!writer || writer->pid != connection.pin.token().pid ||
             writer->uid != connection.pin.token().uid) {
    refusal = "the message was not written by the process that connected";
  }
  UniqueFd opened;
  const std::string answer = refusal.empty() ? exchange(connection, std::move(token), &opened)
                                             : sandboxexchange::kRefused + refusal;
  if (!opened.valid()) refuse(connection, answer);
  sendAnswer(fd, answer, opened.get());
  close(fd);
}

std::string SandboxExtensionServer::exchange(const Connection& connection, std::string token,
                                             UniqueFd* opened) const {
  const std::string refused = sandboxexchange::kRefused;
  if (!token.empty() && token.back() == '\0') token.pop_back();
  // "<token>" or "<token>\0<entry beneath the token's directory>".
  std::string entry;
  if (const std::size_t split = token.find('\0'); split != std::string::npos) {
    entry = token.substr(split + 1);
    token.resize(split);
    if (!isPlainRelativePath(entry)) return refused + "malformed path beneath the token's";
  }
  const std::optional<std::string> path = broker_.verifyExtension(token, connection.pin.token());
  if (!path) return refused + "the token was not issued to this process, or was altered";
  // Verified against the pin: the pinned process must still be the one that spoke.
  if (!connection.pin.stillSame()) return refused + "the process has ended or exec'd";
  std::string kind;
  *opened = openBeneathRoot(*path, &kind);
  if (!opened->valid()) return refused + kind;
  if (entry.empty()) return kind;
  if (kind != sandboxexchange::kDirectory) {
    opened->reset();
    return refused + "nothing lies beneath a file";
  }
  *opened = openEntry(opened->get(), entry, &kind);
  if (!opened->valid()) return refused + kind;
  return kind;
}

bool SandboxExtensionServer::isPlainRelativePath(const std::string& path) {
  // A directory token covers its subtree, and only that: no way up, out or across a link's name.
  if (path.empty() || path.size() > sandboxexchange::kMaxTokenSize) return false;
  for (std::size_t at = 0; at <= path.size();) {
    const std::size_t slash = std::min(path.find('/', at), path.size());
    if (!DeviceRoot::isSingleComponent(std::string_view(path).substr(at, slash - at))) return false;
    at = slash + 1;
  }
  return true;
}

UniqueFd SandboxExtensionServer::openEntry(int directory, const std::string& entry,
                                           std::string* kind) {
  // Beneath the directory the token opened, following no link, so the entry cannot be swapped
  // for one outside; a Landlock sandbox would refuse the application the same open by name.
  UniqueFd fd = openResolved(directory, entry, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC,
                             RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS);
  struct stat info {};
  if (!fd.valid() || fstat(fd.get(), &info) != 0) {
    *kind = std::strerror(errno);
    return {};
  }
  if (!S_ISREG(info.st_mode) && !S_ISDIR(info.st_mode)) {
    *kind = "not a regular file or directory";
    return {};
  }
  *kind = S_ISDIR(info.st_mode) ? sandboxexchange::kDirectory : sandboxexchange::kFile;
  return fd;
}

UniqueFd SandboxExtensionServer::openBeneathRoot(const std::string& path, std::string* kind) const {
  constexpr std::uint64_t kResolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  UniqueFd located =
      typhora::openBeneathRoot(rootFd_.get(), path, O_PATH | O_NOFOLLOW | O_CLOEXEC, kResolve);
  struct stat before {};
  if (!located.valid() || fstat(located.get(), &before) != 0) {
    *kind = std::strerror(errno);
    return {};
  }
  const bool directory = S_ISDIR(before.st_mode);
  if (!directory && !S_ISREG(before.st_mode)) {
    *kind = "not a regular file or directory";
    return {};
  }
  // Opened for reading only once its type is known, and only if it is still the same file.
  const std::uint64_t flags =
      O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | (directory ? O_DIRECTORY : 0);
  UniqueFd fd = typhora::openBeneathRoot(rootFd_.get(), path, flags, kResolve);
  struct stat after {};
  if (!fd.valid() || fstat(fd.get(), &after) != 0) {
    *kind = std::strerror(errno);
    return {};
  }
  if (after.st_dev != before.st_dev || after.st_ino != before.st_ino ||
      (after.st_mode & S_IFMT) != (before.st_mode & S_IFMT)) {
    *kind = "the file changed while it was opened";
    return {};
  }
  *kind = directory ? sandboxexchange::kDirectory : sandboxexchange::kFile;
  return fd;
}

void SandboxExtensionServer::refuse(const Connection& connection, const std::string& reason) {
  const AuditToken& peer = connection.pin.token();
  if (refusalsLogged_.size() >= kMaxLoggedPeers) refusalsLogged_.clear();
  if (!refusalsLogged_.emplace(peer.pid, peer.startTime).second) return;
  SystemLog("sandbox socket: pid %d uid %u %@", static_cast<int>(peer.pid),
            static_cast<unsigned>(connection.uid), reason);
}

}  // namespace typhora
