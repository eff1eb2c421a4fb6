#include "platform/linux/unix_socket_file.h"

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

namespace typhora {

UniqueFd UnixSocketFile::activated(const std::string& name) {
  static std::mutex mutex;
  static std::set<int> taken;
  std::lock_guard lock(mutex);
  char** names = nullptr;
  int count = sd_listen_fds_with_names(0, &names);
  int found = -1;
  for (int i = 0; i < count; ++i) {
    bool matches = names != nullptr && names[i] != nullptr &&
                   (name == names[i] || (count == 1 && std::strcmp(names[i], "unknown") == 0));
    if (matches && found < 0 && !taken.contains(SD_LISTEN_FDS_START + i)) {
      found = SD_LISTEN_FDS_START + i;
    }
  }
  if (found >= 0) {
    taken.insert(found);
    // Inherited sockets come blocking; listeners accept until it would block.
    fcntl(found, F_SETFL, fcntl(found, F_GETFL) | O_NONBLOCK);
    fcntl(found, F_SETFD, FD_CLOEXEC);
  }
  if (names != nullptr) {
    for (int i = 0; i < count; ++i) std::free(names[i]);
    std::free(names);
  }
  return UniqueFd(found);
}

UniqueFd UnixSocketFile::bindListening(const std::string& path, int type, mode_t mode,
                                       std::string* error) {
  // Made under a name of its own and moved into place once it listens with its mode: a client
  // never finds the path refusing connections, nor open wider than `mode`.
  const std::string building = path + ".new-" + std::to_string(getpid());
  UniqueFd fd(socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (building.size() >= sizeof address.sun_path) {
    *error = "socket path too long";
    return {};
  }
  std::memcpy(address.sun_path, building.c_str(), building.size() + 1);
  unlink(building.c_str());
  if (bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      chmod(building.c_str(), mode) != 0 || listen(fd.get(), 1024) != 0 ||
      rename(building.c_str(), path.c_str()) != 0) {
    *error = path + ": " + std::strerror(errno);
    unlink(building.c_str());
    return {};
  }
  return fd;
}

}  // namespace typhora
