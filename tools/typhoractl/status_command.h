// `typhoractl status` and `typhoractl grants`: what the daemon is doing and which fonts it issued
// to which application, asked on the event socket (root or the daemon's user only). JSON by
// default; --table for people, --metrics (status) for a monitoring system's scraper.
#pragma once

#include <string>
#include <vector>

#include "client_command.h"

namespace typhora::ctl {

int runStatusCommand(const ClientOptions& options, const std::vector<std::string>& args);
int runGrantsCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
