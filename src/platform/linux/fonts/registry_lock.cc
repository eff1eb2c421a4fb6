#include "platform/linux/fonts/registry_lock.h"

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>

namespace typhora {

RegistryLock::RegistryLock(std::mutex& mutex, const std::string& lockFile)
    : guard_(mutex), fd_(open(lockFile.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644)) {
  if (!fd_.valid()) return;
  while (flock(fd_.get(), LOCK_EX) != 0 && errno == EINTR) {
  }
}

RegistryLock::~RegistryLock() {
  if (fd_.valid()) flock(fd_.get(), LOCK_UN);
}

}  // namespace typhora
