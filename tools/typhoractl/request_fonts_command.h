// `typhoractl request-fonts`: an application asking the daemon for fonts by name.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

int runRequestFontsCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
