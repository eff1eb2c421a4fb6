// One connection of typhoractl to the daemon's service, on which several calls can be made in
// turn (a check-in and what follows it on the same connection).
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "client_command.h"
#include "platform/ipc/ipc_connection.h"
#include "platform/linux/lumo/lumo_service.h"

namespace typhora::ctl {

struct CallResult {
  bool ok = false;
  std::vector<Value> reply;
  std::string error;
};

class ServiceSession {
 public:
  // With `exported`, the session offers the client's interface to the daemon on the connection,
  // answered by `exported`.
  ServiceSession(const ClientOptions& options, std::shared_ptr<const IpcInterface> remote,
                 std::shared_ptr<IpcExportedObject> exported = nullptr);
  ~ServiceSession();
  ServiceSession(const ServiceSession&) = delete;
  ServiceSession& operator=(const ServiceSession&) = delete;

  // Calls `wireName` and waits for its reply; a one-way call succeeds once it has left.
  CallResult call(const std::string& wireName, std::vector<Value> arguments);

 private:
  ClientOptions options_;
  std::shared_ptr<const IpcInterface> remote_;
  LumoService service_;
  std::shared_ptr<IpcConnection> connection_;
};

// Prints the reply as a JSON array, or the error; answers the exit status.
int printCall(const CallResult& result);

}  // namespace typhora::ctl
