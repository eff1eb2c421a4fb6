#include "platform/linux/lumo/lumo_service.h"

#include <sys/socket.h>

#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_listener.h"
#include "platform/linux/unix_socket_file.h"
#include "platform/log/log.h"

namespace typhora {

LumoService::LumoService(std::string runtimeDir) : runtimeDir_(std::move(runtimeDir)) {}

std::shared_ptr<IpcListener> LumoService::makeNamedListener(const std::string& serviceName) {
  return makeNamedListener(serviceName, 0666);
}

std::shared_ptr<IpcListener> LumoService::makeNamedListener(const std::string& serviceName,
                                                            mode_t mode) {
  if (UniqueFd fd = UnixSocketFile::activated(serviceName); fd.valid()) {
    return LumoListener::named(std::move(fd), "");
  }
  const std::string path = runtimeDir_ + "/" + serviceName;
  std::string error;
  UniqueFd fd = UnixSocketFile::bindListening(path, SOCK_STREAM, mode, &error);
  if (!fd.valid()) {
    SystemLog("lumo error: %s - %@", "-[LumoService makeNamedListener]", error);
    return nullptr;
  }
  return LumoListener::named(std::move(fd), path);
}

std::shared_ptr<IpcListener> LumoService::makeAnonymousListener() {
  return LumoListener::anonymous();
}

std::shared_ptr<IpcConnection> LumoService::connect(std::shared_ptr<const IpcEndpoint> endpoint) {
  return LumoConnection::toEndpoint(std::move(endpoint));
}

std::shared_ptr<IpcConnection> LumoService::connectToService(const std::string& serviceName) {
  return LumoConnection::toPath(runtimeDir_ + "/" + serviceName);
}

}  // namespace typhora
