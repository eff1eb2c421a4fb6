// `typhoractl app-state`: what the compositor tells the platform about running applications.
#pragma once

#include <string>
#include <vector>

namespace typhora::ctl {

// Returns the process exit status.
int runAppStateCommand(const std::string& root, const std::vector<std::string>& args);

}  // namespace typhora::ctl
