#include "platform/linux/files/linux_file_system.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <cerrno>
#include <cstring>
#include <ctime>

#include "platform/log/log.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace {

// Deeper trees are not font directories; the walk holds one descriptor per level.
constexpr int kMaxDepth = 32;
constexpr const char* kRefused = "file system: refused path \"%@\": not a plain absolute path";

bool fail(std::string* error, const std::string& why) {
  if (error != nullptr) *error = why;
  return false;
}

bool failErrno(std::string* error, int code) {
  return fail(error, std::strerror(code));
}

// The names in directory `fd`, or nullopt with errno set.
std::optional<std::vector<std::string>> namesIn(int fd) {
  const int copy = fcntl(fd, F_DUPFD_CLOEXEC, 0);
  if (copy < 0) return std::nullopt;
  DIR* dir = fdopendir(copy);
  if (dir == nullptr) {
    const int saved = errno;
    close(copy);
    errno = saved;
    return std::nullopt;
  }
  rewinddir(dir);
  std::vector<std::string> names;
  errno = 0;
  while (dirent* entry = readdir(dir)) {
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") names.emplace_back(name);
  }
  const int saved = errno;
  closedir(dir);
  errno = saved;
  if (saved != 0) return std::nullopt;
  return names;
}

int removeEntry(int parent, const std::string& name, int depth);

// Removes everything in directory `fd`; 0 or the first error met.
int removeContents(int fd, int depth) {
  if (depth > kMaxDepth) return ELOOP;
  std::optional<std::vector<std::string>> names = namesIn(fd);
  if (!names) return errno;
  int first = 0;
  for (const std::string& name : *names) {
    const int error = removeEntry(fd, name, depth);
    if (first == 0) first = error;
  }
  return first;
}

// Removes entry `name` of directory `parent`: a directory with its contents, anything else
// (a link included) itself. 0 or the first error met.
int removeEntry(int parent, const std::string& name, int depth) {
  struct stat info {};
  if (fstatat(parent, name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (S_ISDIR(info.st_mode)) {
    UniqueFd directory(
        openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (!directory.valid()) return errno;
    if (const int error = removeContents(directory.get(), depth + 1); error != 0) return error;
    return unlinkat(parent, name.c_str(), AT_REMOVEDIR) == 0 ? 0 : errno;
  }
  return unlinkat(parent, name.c_str(), 0) == 0 ? 0 : errno;
}

}  // namespace

LinuxFileSystem::LinuxFileSystem(std::string root) : root_(std::move(root)) {}

std::string LinuxFileSystem::onDisk(const std::string& path) const {
  return root_.onDisk(path);
}

UniqueFd LinuxFileSystem::openBeneath(const std::string& path, int flags) const {
  UniqueFd root(open(root_.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!root.valid()) return root;
  open_how how{};
  how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
  how.resolve = RESOLVE_IN_ROOT | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  const std::string relative = path.size() > 1 ? path.substr(1) : ".";
  for (int attempt = 0; attempt < 8; ++attempt) {
    const long fd = syscall(SYS_openat2, root.get(), relative.c_str(), &how, sizeof how);
    if (fd >= 0) return UniqueFd(static_cast<int>(fd));
    if (errno != EAGAIN && errno != EINTR) break;  // EAGAIN: a rename raced the lookup
  }
  return UniqueFd();
}

UniqueFd LinuxFileSystem::openParent(const std::string& path, std::string* name,
                                     std::string* error) const {
  if (!isPlainAbsolutePath(path)) {
    SystemLog(kRefused, path);
    fail(error, "refused: not a plain absolute path");
    return UniqueFd();
  }
  const std::size_t slash = path.rfind('/');
  *name = path.substr(slash + 1);
  UniqueFd parent = openBeneath(slash == 0 ? "/" : path.substr(0, slash), O_RDONLY | O_DIRECTORY);
  if (!parent.valid()) failErrno(error, errno);
  return parent;
}

bool LinuxFileSystem::fileExists(const std::string& path) const {
  return isPlainAbsolutePath(path) && openBeneath(path, O_PATH | O_NOFOLLOW).valid();
}

std::optional<Value> LinuxFileSystem::readPropertyList(const std::string& path,
                                                       std::string* error) const {
  return PlistReader::readFile(onDisk(path), {}, error);
}

std::optional<FileStamp> LinuxFileSystem::stampOf(const std::string& path) const {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  struct stat info {};
  if (stat(onDisk(path).c_str(), &info) != 0 || !S_ISREG(info.st_mode)) return std::nullopt;
  // Taken before the caller reads the file: a write after that read gets later times.
  if (info.st_ctim.tv_sec >= now.tv_sec - 1) return std::nullopt;
  return FileStamp{static_cast<std::uint64_t>(info.st_dev),
                   static_cast<std::uint64_t>(info.st_ino),
                   static_cast<std::int64_t>(info.st_size),
                   info.st_mtim.tv_sec,
                   info.st_mtim.tv_nsec,
                   info.st_ctim.tv_sec,
                   info.st_ctim.tv_nsec};
}

bool LinuxFileSystem::removeItem(const std::string& path, std::string* error) {
  std::string name;
  UniqueFd parent = openParent(path, &name, error);
  if (!parent.valid()) return false;
  const int code = removeEntry(parent.get(), name, 0);
  return code == 0 || failErrno(error, code);
}

bool LinuxFileSystem::removeEmptyDirectory(const std::string& path, std::string* error) {
  std::string name;
  UniqueFd parent = openParent(path, &name, error);
  if (!parent.valid()) return false;
  return unlinkat(parent.get(), name.c_str(), AT_REMOVEDIR) == 0 || failErrno(error, errno);
}

std::optional<std::vector<std::string>> LinuxFileSystem::contentsOfDirectory(
    const std::string& path) const {
  if (!isPlainAbsolutePath(path)) {
    SystemLog(kRefused, path);
    return std::nullopt;
  }
  UniqueFd directory = openBeneath(path, O_RDONLY | O_DIRECTORY | O_NONBLOCK);
  if (!directory.valid()) return std::nullopt;
  return namesIn(directory.get());
}

}  // namespace typhora
