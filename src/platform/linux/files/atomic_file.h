// Whole-file writes that a crash never leaves torn: the bytes go to a temporary file beside the
// target, which is flushed, renamed over the target, and the directory flushed after it.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <span>
#include <string>

namespace typhora {

class AtomicFile {
 public:
  // Creates the parent directories as needed. False with `error` set when it failed, in which
  // case the old file, if any, is unchanged.
  static bool write(const std::string& path, std::span<const std::uint8_t> bytes, mode_t mode,
                    std::string* error);
  // Writes all of `bytes` to `fd`, retrying short writes and interruptions.
  static bool writeAll(int fd, std::span<const std::uint8_t> bytes);
};

}  // namespace typhora
