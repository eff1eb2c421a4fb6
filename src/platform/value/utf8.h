// UTF-8 validity, for decoders that must refuse malformed text.
#pragma once

#include <cstdint>
#include <cstring>
#include <string_view>

namespace typhora {

// True for well-formed UTF-8 beyond ASCII: no overlong forms, no surrogates, nothing above
// U+10FFFF. Vectorised.
bool isValidUtf8Text(std::string_view text);

// True for well-formed UTF-8. ASCII, by far the most common, is told eight bytes at a time here,
// without a call or the vectorised validator's set-up.
inline bool isValidUtf8(std::string_view text) {
  std::uint64_t high = 0;
  std::size_t i = 0;
  for (; i + 8 <= text.size(); i += 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, text.data() + i, sizeof word);
    high |= word;
  }
  for (; i < text.size(); ++i) high |= static_cast<unsigned char>(text[i]);
  return (high & 0x8080'8080'8080'8080) == 0 || isValidUtf8Text(text);
}

}  // namespace typhora
