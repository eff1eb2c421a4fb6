#include "platform/value/utf8.h"

#include <simdjson.h>

namespace typhora {

bool isValidUtf8(std::string_view text) {
  // Short strings, the most common by far, skip the vectorised validator's set-up.
  bool ascii = text.size() <= 32;
  for (std::size_t i = 0; ascii && i < text.size(); ++i)
    ascii = static_cast<unsigned char>(text[i]) < 0x80;
  return ascii || simdjson::validate_utf8(text.data(), text.size());
}

}  // namespace typhora
