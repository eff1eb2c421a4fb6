// Application states kept in a table that the platform's compositor (or an operator with
// `typhoractl app-state`) updates: <root>/var/run/typhora/app-states.plist,
//   { "<pid>": { "state": <int>, "startTime": <process start, clock ticks since boot> } }
// An entry counts only while its pid still names the process that started then, so a reused
// pid does not inherit a state. Unknown processes are in no known state.
#pragma once

#include <optional>
#include <string>

#include "platform/services/app_state_monitor.h"

namespace typhora {

class LinuxAppStateMonitor final : public AppStateMonitor {
 public:
  explicit LinuxAppStateMonitor(const std::string& root);
  int mostElevatedApplicationState(pid_t pid) const override;

  // Sets the state of the running process `pid` (nullopt removes it), dropping entries of
  // processes that have gone. False with `error` set when it failed.
  bool setState(pid_t pid, std::optional<int> state, std::string* error) const;

 private:
  std::string path_;
};

}  // namespace typhora
