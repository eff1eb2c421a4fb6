#include "platform/linux/files/atomic_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/fd/unique_fd.h"

namespace typhora {

bool AtomicFile::writeAll(int fd, std::span<const std::uint8_t> bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

bool AtomicFile::write(const std::string& path, std::span<const std::uint8_t> bytes, mode_t mode,
                       std::string* error) {
  const std::filesystem::path target(path);
  std::error_code ec;
  std::filesystem::create_directories(target.parent_path(), ec);
  const std::string temporary = path + ".tmp-" + std::to_string(getpid());
  // Never through a link or into a FIFO left at the temporary name.
  UniqueFd fd(open(temporary.c_str(),
                   O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, mode));
  bool ok = fd.valid() && writeAll(fd.get(), bytes) && fsync(fd.get()) == 0;
  fd.reset();
  ok = ok && rename(temporary.c_str(), path.c_str()) == 0;
  if (!ok) {
    if (error != nullptr) *error = std::strerror(errno);
    unlink(temporary.c_str());
    return false;
  }
  UniqueFd directory(open(target.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directory.valid()) fsync(directory.get());
  return true;
}

}  // namespace typhora
