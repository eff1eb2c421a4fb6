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

// `path` (absolute or not) beneath the directory `rootFd`; an invalid descriptor with errno set
// when it cannot be opened.
inline UniqueFd openBeneathRoot(int rootFd, const std::string& path, std::uint64_t flags,
                                std::uint64_t resolve) {
  open_how how{};
  how.flags = flags;
  how.resolve = RESOLVE_IN_ROOT | resolve;
  return UniqueFd(static_cast<int>(syscall(SYS_openat2, rootFd, path.c_str(), &how, sizeof how)));
}

}  // namespace typhora
