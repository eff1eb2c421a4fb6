// `typhoractl sandbox-exec` and `typhoractl sandbox-open`: running an application under the
// kernel's sandbox, and exchanging its tokens for descriptors on the daemon's sandbox socket.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

// Returns only on failure (the exit status); on success the process is the program.
int runSandboxExecCommand(const std::string& root, const std::vector<std::string>& args);
int runSandboxOpenCommand(const ClientOptions& options, const std::string& root,
                          const std::vector<std::string>& args);

}  // namespace typhora::ctl
