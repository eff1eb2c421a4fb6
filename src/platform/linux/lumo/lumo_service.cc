#include "platform/linux/lumo/lumo_service.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <set>

#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_listener.h"
#include "platform/log/log.h"

namespace typhora {
namespace {

// The activated socket named `name`, or -1. Descriptors handed over are kept for the process,
// and each is handed out once: a single unnamed socket goes to the first listener that asks.
int activatedSocket(const std::string& name) {
  static std::mutex mutex;
  static std::set<int> taken;
  std::lock_guard lock(mutex);
  char** names = nullptr;
  int count = sd_listen_fds_with_names(0, &names);
  int found = -1;
  for (int i = 0; i < count; ++i) {
    // A single socket handed over without a name is taken as the service's own.
    bool matches = names != nullptr && names[i] != nullptr &&
                   (name == names[i] || (count == 1 && std::strcmp(names[i], "unknown") == 0));
    if (matches && found < 0 && !taken.contains(SD_LISTEN_FDS_START + i)) {
      found = SD_LISTEN_FDS_START + i;
    }
  }
  if (found >= 0) taken.insert(found);
  if (names != nullptr) {
    for (int i = 0; i < count; ++i) std::free(names[i]);
    std::free(names);
  }
  return found;
}

}  // namespace

LumoService::LumoService(std::string runtimeDir) : runtimeDir_(std::move(runtimeDir)) {}

std::shared_ptr<IpcListener> LumoService::makeNamedListener(const std::string& serviceName) {
  return makeNamedListener(serviceName, 0666);
}

std::shared_ptr<IpcListener> LumoService::makeNamedListener(const std::string& serviceName,
                                                            mode_t mode) {
  if (int fd = activatedSocket(serviceName); fd >= 0) {
    // Inherited sockets come blocking; the I/O loop accepts until it would block.
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    return LumoListener::named(UniqueFd(fd), "");
  }
  const std::string path = runtimeDir_ + "/" + serviceName;
  // Made under a name of its own and moved into place once it listens with its mode: a client
  // never finds the path refusing connections, nor open wider than `mode`.
  const std::string building = path + ".new-" + std::to_string(getpid());
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (building.size() >= sizeof address.sun_path) {
    SystemLog("lumo error: %s - %@", "-[LumoService makeNamedListener]", "socket path too long");
    return nullptr;
  }
  std::memcpy(address.sun_path, building.c_str(), building.size() + 1);
  unlink(building.c_str());
  if (bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      chmod(building.c_str(), mode) != 0 || listen(fd.get(), 1024) != 0 ||
      rename(building.c_str(), path.c_str()) != 0) {
    SystemLog("lumo error: %s - %@", "-[LumoService makeNamedListener]",
              path + ": " + std::strerror(errno));
    unlink(building.c_str());
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
