#include "platform/linux/sandbox/landlock_policy.h"

#include <algorithm>
#include <array>

#include "platform/linux/sandbox/landlock_abi.h"

namespace typhora {
namespace {

constexpr std::uint64_t kRead = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr std::uint64_t kReadExecute = kRead | LANDLOCK_ACCESS_FS_EXECUTE;
// Rights a rule on a regular file or device may hold.
constexpr std::uint64_t kFileRights = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE |
                                      LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_TRUNCATE |
                                      LANDLOCK_ACCESS_FS_IOCTL_DEV;

struct SystemPath {
  const char* path;
  std::uint64_t access;
};

// What any program needs to run. /proc is read as a whole: an IPC client pins the daemon by its
// /proc entries. What /proc shows of other processes beyond their status is behind ptrace access
// checks, which Landlock denies for every process outside the sandbox's domain.
// /dev/null may be written: nothing written there is kept.
constexpr std::array kSystemPaths{
    SystemPath{"/usr", kReadExecute},
    SystemPath{"/lib", kReadExecute},
    SystemPath{"/lib64", kReadExecute},
    SystemPath{"/lib32", kReadExecute},
    SystemPath{"/libx32", kReadExecute},
    SystemPath{"/bin", kReadExecute},
    SystemPath{"/sbin", kReadExecute},
    SystemPath{"/etc", kRead},
    SystemPath{"/dev/null", LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_WRITE_FILE},
    SystemPath{"/dev/urandom", LANDLOCK_ACCESS_FS_READ_FILE},
    SystemPath{"/proc", kRead},
    SystemPath{"/sys/devices/system/cpu", kRead},
};

bool beneath(const std::string& path, const std::string& directory) {
  if (directory == "/") return true;
  return path.starts_with(directory) &&
         (path.size() == directory.size() || path[directory.size()] == '/');
}

}  // namespace

std::uint64_t LandlockPolicy::fsRights(int abi) {
  if (abi < 1) return 0;
  std::uint64_t rights = (LANDLOCK_ACCESS_FS_MAKE_SYM << 1) - 1;  // ABI 1: bits 0 to 12
  if (abi >= 2) rights |= LANDLOCK_ACCESS_FS_REFER;
  if (abi >= 3) rights |= LANDLOCK_ACCESS_FS_TRUNCATE;
  if (abi >= 5) rights |= LANDLOCK_ACCESS_FS_IOCTL_DEV;
  return rights;
}

std::uint64_t LandlockPolicy::netRights(int abi) {
  return abi >= 4 ? LANDLOCK_ACCESS_NET_BIND_TCP | LANDLOCK_ACCESS_NET_CONNECT_TCP : 0;
}

std::uint64_t LandlockPolicy::scopes(int abi) {
  return abi >= 6 ? LANDLOCK_SCOPE_ABSTRACT_UNIX_SOCKET | LANDLOCK_SCOPE_SIGNAL : 0;
}

std::uint64_t LandlockPolicy::forFile(std::uint64_t access) {
  return access & kFileRights;
}

std::optional<LandlockPolicy> LandlockPolicy::forApplication(const AppManifest& manifest,
                                                             const std::string& deviceRoot,
                                                             const std::string& program, int abi,
                                                             std::string* error) {
  LandlockPolicy policy;
  policy.abi_ = std::min(abi, kNewestKnownAbi);
  const std::uint64_t known = policy.handledFs();
  for (const SystemPath& system : kSystemPaths) {
    // A device root of "/" is the machine's own: its system directories are not the daemon's.
    if (deviceRoot != "/" && beneath(deviceRoot, system.path)) {
      *error = "the device root " + deviceRoot + " lies beneath " + system.path +
               ", which every sandboxed program may read";
      return std::nullopt;
    }
    policy.rules_.push_back({system.path, system.access & known, false});
  }
  policy.rules_.push_back(
      {program, (LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_READ_FILE) & known, false});
  for (const std::string& path : manifest.readOnlyPaths) {
    if (path.empty() || path.front() != '/') continue;  // daemon paths are absolute
    policy.rules_.push_back({path, kRead, true});
  }
  return policy;
}

}  // namespace typhora
