// lumo, the platform's service IPC on Unix domain sockets.
#pragma once

#include <sys/types.h>

#include <string>

#include "platform/ipc/ipc_listener.h"

namespace typhora {

class LumoService final : public IpcService {
 public:
  // Named services live as sockets "<runtimeDir>/<service name>".
  explicit LumoService(std::string runtimeDir);

  // Takes the socket of that name from systemd socket activation when there is one; otherwise
  // binds a new socket in the runtime directory (replacing a stale one). Null when neither works.
  std::shared_ptr<IpcListener> makeNamedListener(const std::string& serviceName) override;
  // The same, with the socket's file mode (a socket systemd hands over keeps the unit's mode).
  std::shared_ptr<IpcListener> makeNamedListener(const std::string& serviceName, mode_t mode);
  std::shared_ptr<IpcListener> makeAnonymousListener() override;
  std::shared_ptr<IpcConnection> connect(std::shared_ptr<const IpcEndpoint> endpoint) override;
  std::shared_ptr<IpcConnection> connectToService(const std::string& serviceName) override;

 private:
  std::string runtimeDir_;
};

}  // namespace typhora
