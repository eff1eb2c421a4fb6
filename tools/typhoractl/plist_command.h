// `typhoractl plist`: show and convert property-list files.
#pragma once

#include <string>
#include <vector>

namespace typhora::ctl {

// Returns the process exit status.
int runPlistCommand(const std::vector<std::string>& args);

}  // namespace typhora::ctl
