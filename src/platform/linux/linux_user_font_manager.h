// The font registry on Linux, as far as the daemon uses it so far.
#pragma once

#include <string>

#include "platform/ty_user_font_manager.h"

namespace typhora {

class LinuxUserFontManager final : public TYUserFontManager {
 public:
  explicit LinuxUserFontManager(std::string root);
  // Lays out the registry's directories (font files and font assets) under the root.
  void reset() override;

 private:
  std::string root_;
};

}  // namespace typhora
