#include "platform/value/utf8.h"

#include <simdjson.h>

#include <cstdint>
#include <cstring>

namespace typhora {

bool isValidUtf8(std::string_view text) {
  // ASCII, by far the most common, is told eight bytes at a time without the vectorised
  // validator's set-up.
  std::uint64_t high = 0;
  std::size_t i = 0;
  for (; i + 8 <= text.size(); i += 8) {
    std::uint64_t word = 0;
    std::memcpy(&word, text.data() + i, sizeof word);
    high |= word;
  }
  for (; i < text.size(); ++i) high |= static_cast<unsigned char>(text[i]);
  return (high & 0x8080'8080'8080'8080) == 0 || simdjson::validate_utf8(text.data(), text.size());
}

}  // namespace typhora
