// Kernel-verified identity of peer processes, pinned to the process instance.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/ipc/audit_token.h"

namespace typhora {

class ProcessIdentity {
 public:
  // The token of the peer of a connected Unix socket (SO_PEERCRED), pinned to the peer's start
  // time and executable now. The zero token when the peer cannot be identified.
  static AuditToken ofSocketPeer(int fd);
  // The token of a running process by pid (pinned now).
  static AuditToken ofProcess(pid_t pid, uid_t uid, gid_t gid);
  // The same, read through the process's /proc directory opened already (O_PATH will do).
  static AuditToken ofProcessDirectory(int directory, pid_t pid, uid_t uid, gid_t gid);
  // The start time of the process whose /proc directory `directory` is.
  static std::optional<std::uint64_t> startTimeIn(int directory);
  // False for the zero token, a process that has gone, a reused pid, or a process that has
  // exec'd another program since the token was taken. A process a connection holds pinned is
  // checked through the pinned directory (`PinnedProcesses`).
  static bool isValid(const AuditToken& token);
  // The start time of process `pid` (clock ticks since boot), when it runs.
  static std::optional<std::uint64_t> startTime(pid_t pid);
  // The contents of /proc/<pid>/<name>; nullopt when it cannot be read (the process has gone).
  static std::optional<std::string> readProcessFile(pid_t pid, const char* name);
  // The executable the token's process runs, when the token is still valid.
  static std::optional<std::string> executablePath(const AuditToken& token);
};

}  // namespace typhora
