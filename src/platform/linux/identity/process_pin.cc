#include "platform/linux/identity/process_pin.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <string>

#include "platform/linux/identity/pinned_processes.h"
#include "platform/linux/identity/process_identity.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77  // Linux 6.5; older headers lack it
#endif

namespace typhora {
namespace {

// A daemon running as its own user may not signal a peer of another user: EPERM still says the
// process is there; only ESRCH says it has ended.
bool alive(int pidfd) {
  return syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0 || errno == EPERM;
}

}  // namespace

ProcessPin ProcessPin::ofSocketPeer(int fd, int* error) {
  ucred cred{};
  socklen_t length = sizeof cred;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0 || cred.pid <= 0) return {};
  int pidfd = -1;
  socklen_t pidfdLength = sizeof pidfd;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &pidfdLength) != 0) pidfd = -1;
  UniqueFd peerPidfd(pidfd);
  return pin(cred.pid, cred.uid, cred.gid, peerPidfd.get(), true, error);
}

ProcessPin ProcessPin::ofWriter(pid_t pid, uid_t uid, gid_t gid) {
  if (pid <= 0) return {};
  return pin(pid, uid, gid, -1, false);
}

ProcessPin ProcessPin::pin(pid_t pid, uid_t uid, gid_t gid, int peerPidfd, bool needExecutable,
                           int* error) {
  UniqueFd directory(
      open(("/proc/" + std::to_string(pid)).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory.valid()) {
    if (error != nullptr) *error = errno;
    return {};
  }
  ProcessPin result;
  result.token_ = ProcessIdentity::ofProcessDirectory(directory.get(), pid, uid, gid);
  result.executableKnown_ = !result.token_.isZero();
  if (!result.executableKnown_ && error != nullptr && (errno == EMFILE || errno == ENFILE)) {
    *error = errno;  // out of descriptors while reading the process, not a process gone
    return {};
  }
  if (!result.executableKnown_ && !needExecutable) {
    const std::optional<std::uint64_t> start = ProcessIdentity::startTimeIn(directory.get());
    if (start) result.token_ = AuditToken{pid, uid, gid, *start, 0, 0};
  }
  result.procDir_ = std::make_shared<const UniqueFd>(std::move(directory));
  // The peer's own pidfd still alive after the directory was opened: the pid named the peer
  // then, not a process that reused it.
  if (peerPidfd >= 0 && !alive(peerPidfd)) return {};
  if (result.token_.isZero() || !result.stillSame()) return {};
  // Only a pin whose executable is known (and so checked by every query) is found by token.
  if (result.executableKnown_) PinnedProcesses::shared().add(result.token_, result.procDir_);
  return result;
}

ProcessPin::State ProcessPin::state() const {
  if (!procDir_ || !procDir_->valid()) return State::Gone;
  struct stat info {};
  if (!executableKnown_) {
    return fstatat(procDir_->get(), "stat", &info, 0) == 0 ? State::Same : State::Gone;
  }
  if (fstatat(procDir_->get(), "exe", &info, 0) != 0) return State::Gone;
  const bool same = info.st_dev == token_.exeDevice && info.st_ino == token_.exeInode;
  return same ? State::Same : State::Changed;
}

}  // namespace typhora
