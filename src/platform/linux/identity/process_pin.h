// A peer process pinned as one instance: its audit token and its /proc directory, held open.
// The held directory keeps answering for that process only (once the process has gone, reads
// through it fail, even if its pid is reused), so checking that the peer still runs the same
// program costs one fstatat, cheap enough to do before every message it sends.
#pragma once

#include <sys/types.h>

#include <memory>

#include "platform/fd/unique_fd.h"
#include "platform/ipc/audit_token.h"

namespace typhora {

class ProcessPin {
 public:
  ProcessPin() = default;
  // The peer of a connected Unix socket (SO_PEERCRED, and the kernel's pidfd of the peer where
  // the kernel offers one, which rules out a pid reused before the pin was taken).
  // `error`, when given, gets the errno of a failure to open the peer's directory (EMFILE...).
  static ProcessPin ofSocketPeer(int fd, int* error = nullptr);
  // The process that wrote a message (the kernel's credentials passed with it). Another user's
  // executable may be closed to this process: the pin then rests on the process instance alone
  // (pid and start time) and its token names no executable.
  static ProcessPin ofWriter(pid_t pid, uid_t uid, gid_t gid);

  const AuditToken& token() const { return token_; }
  bool pinned() const { return !token_.isZero(); }
  enum class State { Same, Gone, Changed };
  // Same: the pinned process runs the program it ran when pinned. Changed: it runs another one
  // (it exec'd). Gone: it has ended.
  State state() const;
  bool stillSame() const { return state() == State::Same; }

 private:
  static ProcessPin pin(pid_t pid, uid_t uid, gid_t gid, int peerPidfd, bool needExecutable,
                        int* error = nullptr);

  AuditToken token_;
  // Shared with `PinnedProcesses`, which finds it again by token while a pin holds it.
  std::shared_ptr<const UniqueFd> procDir_;
  bool executableKnown_ = false;
};

}  // namespace typhora
