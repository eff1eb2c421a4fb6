// The daemon's resident memory and open descriptors, read from /proc of its pid.
#pragma once

#include <sys/types.h>

#include <string>

namespace typhora::torture {

class DaemonGauge {
 public:
  explicit DaemonGauge(pid_t pid) : pid_(pid) {}

  // The pid of the process that listens on `socket` (the peer of a connection to it), or -1.
  static pid_t pidListeningOn(const std::string& socket);

  pid_t pid() const { return pid_; }
  bool alive() const;
  long rssKb() const;        // -1 when unreadable
  long descriptors() const;  // -1 when unreadable

 private:
  pid_t pid_;
};

}  // namespace typhora::torture
