// `typhoractl event` and `typhoractl activity`: play the platform on the daemon's event socket.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "client_command.h"
#include "platform/ipc/ipc_connection.h"
#include "platform/linux/lumo/lumo_service.h"

namespace typhora::ctl {

// A connection to the event socket; `exported` serves what the socket sends back.
std::shared_ptr<IpcConnection> connectToEvents(LumoService& service,
                                               std::shared_ptr<IpcExportedObject> exported);
// Calls `wireName` and waits for the reply; nullopt (with a message printed) when it failed.
std::optional<std::vector<Value>> callEvents(IpcConnection& connection, const std::string& wireName,
                                             std::vector<Value> arguments);

// Return the process exit status.
int runEventCommand(const ClientOptions& options, const std::vector<std::string>& args);
int runActivityCommand(const ClientOptions& options, const std::vector<std::string>& args);

}  // namespace typhora::ctl
