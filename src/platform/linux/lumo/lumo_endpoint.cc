#include "platform/linux/lumo/lumo_endpoint.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace typhora {

std::shared_ptr<const LumoEndpoint> LumoEndpoint::inherited(int fd, std::string* error) {
  struct stat info {};
  if (fstat(fd, &info) != 0) {
    *error = "descriptor " + std::to_string(fd) + ": " + std::strerror(errno);
    return nullptr;
  }
  if (!S_ISSOCK(info.st_mode)) {
    *error = "descriptor " + std::to_string(fd) + " is not an endpoint";
    return nullptr;
  }
  // Not to be handed on to programs this one starts.
  fcntl(fd, F_SETFD, FD_CLOEXEC);
  return std::make_shared<const LumoEndpoint>(UniqueFd(fd));
}

}  // namespace typhora
