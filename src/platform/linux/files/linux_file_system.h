// The daemon's file operations under a device root: "/var/mobile/x" is "<root>/var/mobile/x".
//
// Existence tests, removal and listing act on paths that clients name. Such a path must be plain
// (see FileSystem::isPlainAbsolutePath) and is resolved by the kernel beneath the root with no
// symbolic link followed; a tree is removed by descriptor, entry by entry, so a link inside it
// is removed itself and never leads anywhere.
#pragma once

#include <string>

#include "platform/fd/unique_fd.h"
#include "platform/linux/files/device_root.h"
#include "platform/storage/file_system.h"

namespace typhora {

class LinuxFileSystem final : public FileSystem {
 public:
  explicit LinuxFileSystem(std::string root);
  bool fileExists(const std::string& path) const override;
  std::optional<Value> readPropertyList(const std::string& path, std::string* error) const override;
  // File times tick coarsely (by the clock's tick, by the second on some file systems): a file
  // changed in the last second or two has no stamp yet.
  std::optional<FileStamp> stampOf(const std::string& path) const override;
  bool removeItem(const std::string& path, std::string* error) override;
  bool removeEmptyDirectory(const std::string& path, std::string* error) override;
  std::optional<std::vector<std::string>> contentsOfDirectory(
      const std::string& path) const override;
  // The machine's path of one of the daemon's paths.
  std::string onDisk(const std::string& path) const;

 private:
  // `path` opened beneath the root; errno is set when the result is not valid.
  UniqueFd openBeneath(const std::string& path, int flags) const;
  // The directory holding `path`, opened beneath the root, and the entry's name in it.
  UniqueFd openParent(const std::string& path, std::string* name, std::string* error) const;

  DeviceRoot root_;
};

}  // namespace typhora
