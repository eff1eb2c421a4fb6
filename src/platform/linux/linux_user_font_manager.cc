#include "platform/linux/linux_user_font_manager.h"

#include <filesystem>

#include "platform/log.h"

namespace typhora {

LinuxUserFontManager::LinuxUserFontManager(std::string root) : root_(std::move(root)) {}

void LinuxUserFontManager::reset() {
  std::error_code ec;
  for (const char* dir :
       {"/var/mobile/Library/UserFonts/FontFiles", "/var/mobile/Library/UserFonts/FontAssets"}) {
    std::filesystem::create_directories(root_ + dir, ec);
    if (ec)
      TYLog_Error(kTYLogTyphoraDaemon, "font registry: cannot create %@: %@", root_ + dir,
                  ec.message());
  }
}

}  // namespace typhora
