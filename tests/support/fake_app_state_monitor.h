// Application states by pid, as a test sets them; unknown processes are in no known state.
#pragma once

#include <map>
#include <mutex>

#include "platform/services/app_state_monitor.h"

namespace typhora::testing {

class FakeAppStateMonitor final : public AppStateMonitor {
 public:
  void setState(pid_t pid, int state) {
    std::lock_guard lock(mutex_);
    states_[pid] = state;
  }
  int mostElevatedApplicationState(pid_t pid) const override {
    std::lock_guard lock(mutex_);
    auto it = states_.find(pid);
    return it == states_.end() ? kApplicationStateUnknown : it->second;
  }

 private:
  mutable std::mutex mutex_;
  std::map<pid_t, int> states_;
};

}  // namespace typhora::testing
