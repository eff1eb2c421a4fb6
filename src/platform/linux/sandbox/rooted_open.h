// Opening a daemon path beneath the device root with openat2: ".." and absolute symlinks stay
// inside the root (RESOLVE_IN_ROOT), whatever a user placed beneath it.
#pragma once

#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdint>
#include <string>

#include "platform/fd/unique_fd.h"

namespace typhora {

// openat2(2): `path` from the directory `directoryFd` under the `resolve` rules; an invalid
// descriptor with errno set when it cannot be opened.
inline UniqueFd openResolved(int directoryFd, const std::string& path, std::uint64_t flags,
                             std::uint64_t resolve) {
  open_how how{};
  how.flags = flags;
  how.resolve = resolve;
  return UniqueFd(
      static_cast<int>(syscall(SYS_openat2, directoryFd, path.c_str(), &how, sizeof how)));
}

// `path` (absolute or not) beneath the directory `rootFd`.
inline UniqueFd openBeneathRoot(int rootFd, const std::string& path, std::uint64_t flags,
                                std::uint64_t resolve) {
  return openResolved(rootFd, path, flags, RESOLVE_IN_ROOT | resolve);
}

}  // namespace typhora
