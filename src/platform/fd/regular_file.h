// Reading a file without ever blocking: a FIFO, device or socket in a file's place is refused
// instead of holding the reader up.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/fd/unique_fd.h"

namespace typhora {

class RegularFile {
 public:
  // `path` opened for reading, non-blocking, when it is a regular file of at most `maxBytes`
  // (its size in `size`); an invalid descriptor with `error` set otherwise.
  static UniqueFd open(const std::string& path, std::size_t maxBytes, std::size_t* size,
                       std::string* error);
  // Reads from `fd` until `bytes` is full or the file ends; the bytes read in `done`. False with
  // `error` set on a read error.
  static bool readInto(int fd, std::span<std::uint8_t> bytes, std::size_t* done,
                       std::string* error);
  // The whole regular file at `path`; nullopt with `error` set when open() or readInto() fails.
  static std::optional<std::vector<std::uint8_t>> read(const std::string& path,
                                                       std::size_t maxBytes, std::string* error);
};

}  // namespace typhora
