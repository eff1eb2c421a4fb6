// The kernel-verified identity of a peer process, taken when it connected and pinned to that
// process instance: its pid, uid and gid, its start time, and the executable it ran then.
// Identity never comes from what a client says. The all-zero token stands for "no caller" and
// every query made with it fails.
#pragma once

#include <sys/types.h>
#include <cstdint>
#include <string>

namespace typhora {

struct AuditToken {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  std::uint64_t startTime = 0;  // process start, in clock ticks since boot (/proc/PID/stat)
  std::uint64_t exeDevice = 0;  // st_dev of /proc/PID/exe at connect
  std::uint64_t exeInode = 0;   // st_ino of /proc/PID/exe at connect

  bool isZero() const { return pid == 0 && startTime == 0 && exeInode == 0; }
  std::string description() const;
  friend bool operator==(const AuditToken&, const AuditToken&) = default;
};

}  // namespace typhora
