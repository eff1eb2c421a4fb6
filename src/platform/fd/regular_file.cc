#include "platform/fd/regular_file.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace typhora {

namespace {

bool fail(std::string* error, std::string why) {
  if (error != nullptr) *error = std::move(why);
  return false;
}

}  // namespace

UniqueFd RegularFile::open(const std::string& path, std::size_t maxBytes, std::size_t* size,
                           std::string* error) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  struct stat info {};
  if (!fd.valid()) {
    fail(error, std::string("cannot open: ") + std::strerror(errno));
  } else if (fstat(fd.get(), &info) != 0) {
    fail(error, std::string("cannot read: ") + std::strerror(errno));
  } else if (!S_ISREG(info.st_mode)) {
    fail(error, "not a regular file");
  } else if (static_cast<std::uint64_t>(info.st_size) > maxBytes) {
    fail(error, "file larger than the size limit");
  } else {
    *size = static_cast<std::size_t>(info.st_size);
    return fd;
  }
  return UniqueFd();
}

bool RegularFile::readInto(int fd, std::span<std::uint8_t> bytes, std::size_t* done,
                           std::string* error) {
  *done = 0;
  while (*done < bytes.size()) {
    const ssize_t n = ::read(fd, bytes.data() + *done, bytes.size() - *done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return fail(error, std::string("cannot read: ") + std::strerror(errno));
    if (n == 0) break;  // the file shrank while being read: what is there is what it holds
    *done += static_cast<std::size_t>(n);
  }
  return true;
}

std::optional<std::vector<std::uint8_t>> RegularFile::read(const std::string& path,
                                                           std::size_t maxBytes,
                                                           std::string* error) {
  std::size_t size = 0;
  UniqueFd fd = open(path, maxBytes, &size, error);
  if (!fd.valid()) return std::nullopt;
  std::vector<std::uint8_t> bytes(size);
  std::size_t done = 0;
  if (!readInto(fd.get(), bytes, &done, error)) return std::nullopt;
  bytes.resize(done);
  return bytes;
}

}  // namespace typhora
