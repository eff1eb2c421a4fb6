// `typhoractl event` and `typhoractl activity`: play the platform on the daemon's event socket.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

// Return the process exit status.
int runEventCommand(const ClientOptions& options, const std::vector<std::string>& args);
int runActivityCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
