// `typhoractl` as a client of the daemon: named calls and a generic `call`.
#pragma once

#include <string>
#include <vector>

namespace typhora::ctl {

struct ClientOptions {
  std::string runtimeDir;
  int timeoutSeconds = 30;
};

// Returns the process exit status.
int runClientCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
