// `typhoractl view-service`: plays the font-install view service the daemon starts to present a
// controller. Reads the user info from standard input, connects to the endpoint on descriptor 3
// and answers through it.
#pragma once

#include <string>
#include <vector>

namespace typhora::ctl {

// Returns the process exit status.
int runViewServiceCommand(const std::vector<std::string>& args);

}  // namespace typhora::ctl
