// The font registry's lock: its threads in this process, and every other process that changes the
// registry's files (the daemon, typhoractl font), take it before they read what they will rewrite,
// so no change of one is written over by another's older copy. In-process through a mutex, between
// processes through flock(2) on a lock file beside the user-fonts file.
#pragma once

#include <mutex>
#include <string>

#include "platform/fd/unique_fd.h"

namespace typhora {

class RegistryLock {
 public:
  // Blocks until both are held. When the lock file cannot be opened (a read-only root), only the
  // mutex is held, which is all a process that cannot write the registry needs.
  RegistryLock(std::mutex& mutex, const std::string& lockFile);
  ~RegistryLock();
  RegistryLock(const RegistryLock&) = delete;
  RegistryLock& operator=(const RegistryLock&) = delete;

 private:
  std::lock_guard<std::mutex> guard_;
  UniqueFd fd_;
};

}  // namespace typhora
