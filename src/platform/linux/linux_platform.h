// The real platform on Linux, every path under one device root.
#pragma once

#include <memory>
#include <string>

#include "platform/linux/linux_file_system.h"
#include "platform/linux/linux_user_font_manager.h"
#include "platform/linux/lumo_service.h"
#include "platform/linux/preferences_file_store.h"
#include "platform/platform.h"

namespace typhora {

class LinuxPlatform {
 public:
  LinuxPlatform(const std::string& root, const std::string& runtimeDir);
  Platform& bundle() { return bundle_; }

 private:
  LumoService ipc_;
  PreferencesFileStore preferences_;
  LinuxFileSystem fileSystem_;
  LinuxUserFontManager fontManager_;
  Platform bundle_;
};

}  // namespace typhora
