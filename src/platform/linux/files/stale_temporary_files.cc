#include "platform/linux/files/stale_temporary_files.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <filesystem>
#include <string_view>

#include "platform/fd/unique_fd.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

// The writer's pid when `entry` is a temporary file of `name`, else 0.
pid_t writerOf(std::string_view entry, std::string_view name) {
  constexpr std::string_view kInfix = ".tmp-";
  if (!entry.starts_with(name)) return 0;
  entry.remove_prefix(name.size());
  if (!entry.starts_with(kInfix)) return 0;
  entry.remove_prefix(kInfix.size());
  pid_t pid = 0;
  auto [end, error] = std::from_chars(entry.data(), entry.data() + entry.size(), pid);
  if (error != std::errc() || end != entry.data() + entry.size() || pid <= 0) return 0;
  return pid;
}

bool hasEnded(pid_t pid) {
  return kill(pid, 0) != 0 && errno == ESRCH;
}

}  // namespace

int StaleTemporaryFiles::removeBeside(const std::string& target) {
  const std::filesystem::path path(target);
  const std::string name = path.filename().string();
  UniqueFd directory(
      open(path.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!directory.valid()) return 0;
  DIR* listing = fdopendir(dup(directory.get()));
  if (listing == nullptr) return 0;
  int removed = 0;
  while (const dirent* entry = readdir(listing)) {
    const pid_t writer = writerOf(entry->d_name, name);
    if (writer == 0 || writer == getpid() || !hasEnded(writer)) continue;
    struct stat info {};
    if (fstatat(directory.get(), entry->d_name, &info, AT_SYMLINK_NOFOLLOW) != 0 ||
        !S_ISREG(info.st_mode)) {
      continue;
    }
    if (unlinkat(directory.get(), entry->d_name, 0) == 0) {
      ++removed;
      TYLog(kTYLogTyphoraDaemon, "removed %@, left by writer %@ that ended mid-write",
            (path.parent_path() / entry->d_name).string(), static_cast<std::int64_t>(writer));
    }
  }
  closedir(listing);
  return removed;
}

}  // namespace typhora
