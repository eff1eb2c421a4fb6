// Figures of a process from /proc/PID/status, for the tools that watch the daemon's footprint.
#pragma once

#include <sys/types.h>

namespace typhora {

// The number after `field` (for example "VmRSS:" in kB, "Threads:"), or -1 when the process or
// the field is not there.
long procStatusField(pid_t pid, const char* field);

}  // namespace typhora
