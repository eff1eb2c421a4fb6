// UTF-8 validity, for decoders that must refuse malformed text.
#pragma once

#include <string_view>

namespace typhora {

// True for well-formed UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool isValidUtf8(std::string_view text);

}  // namespace typhora
