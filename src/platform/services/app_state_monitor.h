// The application states of running processes, as the platform's compositor reports them.
#pragma once

#include <sys/types.h>

namespace typhora {

// The platform's numbering of application states, of which the daemon needs two.
inline constexpr int kApplicationStateUnknown = 0;
inline constexpr int kApplicationStateForegroundRunning = 8;

class AppStateMonitor {
 public:
  virtual ~AppStateMonitor() = default;
  // The most elevated state of any application running in process `pid`;
  // kApplicationStateUnknown for a process the platform does not know.
  virtual int mostElevatedApplicationState(pid_t pid) const = 0;
};

}  // namespace typhora
