// The daemon's file operations under a device root: "/var/mobile/x" is "<root>/var/mobile/x".
#pragma once

#include <string>

#include "platform/file_system.h"
#include "platform/linux/device_root.h"

namespace typhora {

class LinuxFileSystem final : public FileSystem {
 public:
  explicit LinuxFileSystem(std::string root);
  bool fileExists(const std::string& path) const override;
  std::optional<Value> readPropertyList(const std::string& path, std::string* error) const override;
  bool removeItem(const std::string& path, std::string* error) override;
  std::optional<std::vector<std::string>> contentsOfDirectory(
      const std::string& path) const override;
  // The machine's path of one of the daemon's paths.
  std::string onDisk(const std::string& path) const;

 private:
  DeviceRoot root_;
};

}  // namespace typhora
