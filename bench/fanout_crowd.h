// Checked-in clients of the real daemon for the fan-out workload: child processes of this program,
// each running as its own user (a user may hold only so many connections) with its share of the
// connections, reporting when every one of them has received a round's font change.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

namespace typhora::bench {

class FanoutCrowd {
 public:
  // `clients` connections over `processes` children, each checked in before this returns.
  FanoutCrowd(const std::string& runtimeDir, int clients, int processes);
  ~FanoutCrowd();
  FanoutCrowd(const FanoutCrowd&) = delete;
  FanoutCrowd& operator=(const FanoutCrowd&) = delete;

  bool ready() const { return ready_; }
  // Waits for every child to report the round: the latest steady-clock time (ns) at which one of
  // its connections received the change, and the size of a message's arguments. False on error.
  bool awaitRound(std::int64_t* lastReceipt, std::size_t* messageBytes);

 private:
  struct Child {
    pid_t pid = -1;
    int out = -1;  // the child's reports
  };
  bool readLine(const Child& child, std::string* line);

  std::vector<Child> children_;
  bool ready_ = false;
};

// The child's side (`compare --fanout-client RUNTIME COUNT UID`): never returns.
[[noreturn]] void runFanoutClient(const std::string& runtimeDir, int count, uid_t uid);

}  // namespace typhora::bench
