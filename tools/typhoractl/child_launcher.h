// Starts a peer program of typhoractl with one descriptor handed over as its descriptor 3, the
// way the platform hands a view service its endpoint, and waits for it.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace typhora::ctl {

class ChildLauncher {
 public:
  // Starts `program` with `arguments` (argv[1...]) and `fd` as descriptor 3; standard streams
  // are shared. -1 with `error` set when it could not be started.
  static pid_t start(const std::string& program, const std::vector<std::string>& arguments, int fd,
                     std::string* error);
  // Waits for `pid` to end: its exit status, 128 + signal when killed.
  static int wait(pid_t pid);
};

}  // namespace typhora::ctl
