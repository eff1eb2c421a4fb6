#include "platform/linux/files/corrupt_file_quarantine.h"

#include <sys/stat.h>

#include <cstdio>
#include <ctime>

#include "platform/fd/regular_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/files/preferences_file_store.h"
#include "platform/linux/files/stale_temporary_files.h"
#include "platform/log/log.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace {

// Larger than any state file the daemon writes; a bigger one is set aside as well.
constexpr std::size_t kMaxStateFileBytes = 64u << 20;

}  // namespace

void CorruptFileQuarantine::sweep(const std::string& root) {
  const DeviceRoot device(root);
  for (const char* path :
       {"/var/mobile/Library/UserFonts/UserFonts.plist",
        "/var/mobile/Library/UserFonts/ProfileFonts.plist",
        "/var/mobile/Library/UserFonts/FontProviders.plist",
        "/var/mobile/Library/UserFonts/FontAssets.plist", "/var/run/typhora/app-states.plist"}) {
    StaleTemporaryFiles::removeBeside(device.onDisk(path));
    setAsideIfUndecodable(device.onDisk(path));
  }
  const std::string preferences = PreferencesFileStore::pathFor(root, "com.zorvane.typhorad");
  StaleTemporaryFiles::removeBeside(preferences);
  setAsideIfUndecodable(preferences);
}

std::optional<std::string> CorruptFileQuarantine::setAsideIfUndecodable(const std::string& path) {
  struct stat info {};
  if (lstat(path.c_str(), &info) != 0 || !S_ISREG(info.st_mode)) return std::nullopt;
  std::string why;
  if (info.st_size == 0) {
    why = "empty";
  } else if (static_cast<std::size_t>(info.st_size) > kMaxStateFileBytes) {
    why = "larger than any state file";
  } else {
    std::string error;
    std::optional<std::vector<std::uint8_t>> bytes =
        RegularFile::read(path, kMaxStateFileBytes, &error);
    if (!bytes) return std::nullopt;  // unreadable now is not proof of damage
    if (PlistReader::decodes(*bytes, {}, &error)) return std::nullopt;
    why = error;
  }
  const std::string aside = path + ".corrupt-" + std::to_string(std::time(nullptr));
  if (std::rename(path.c_str(), aside.c_str()) != 0) {
    TYLog_Error(kTYLogTyphoraDaemon, "state file %@ is corrupt (%@) and cannot be set aside", path,
                why);
    return std::nullopt;
  }
  TYLog_Error(kTYLogTyphoraDaemon, "state file %@ is corrupt (%@); set aside as %@", path, why,
              aside);
  return aside;
}

}  // namespace typhora
