// `typhoractl load`: many connections calling one operation of the daemon at once, and how long
// the answers took.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

// Returns the process exit status.
int runLoadCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
