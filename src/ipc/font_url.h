// The path of a font's URL string, as the font registry reports changed fonts: "file:///..."
// (percent escapes decoded) or a plain absolute path. Strings that are no URL (spaces, control
// or non-ASCII characters, broken escapes) have none.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace typhora {

class FontUrl {
 public:
  static std::optional<std::string> path(std::string_view url);
};

}  // namespace typhora
