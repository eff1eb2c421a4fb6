// `typhoractl view-service`: plays the font-install view service that the daemon's alerts start.
#pragma once

#include <string>
#include <vector>

namespace typhora::ctl {

// Returns the process exit status.
int runViewServiceCommand(const std::vector<std::string>& args);

}  // namespace typhora::ctl
