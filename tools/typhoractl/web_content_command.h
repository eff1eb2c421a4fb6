// The web-content roles of typhoractl:
//   web-content-app  an application that checks in, starts web-content processes and has the
//                    daemon deliver fonts to each (checkinForBrisvelProcess:reply:);
//   web-content      a web-content process, started by the application with a socket as its
//                    descriptor 3 on which it hands over its endpoint; it prints what it receives.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

int runWebContentAppCommand(const ClientOptions& options, const std::vector<std::string>& args);
int runWebContentCommand(const std::vector<std::string>& args);

}  // namespace typhora::ctl
