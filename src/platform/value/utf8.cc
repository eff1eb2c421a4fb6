#include "platform/value/utf8.h"

#include <simdjson.h>

namespace typhora {

bool isValidUtf8Text(std::string_view text) {
  return simdjson::validate_utf8(text.data(), text.size());
}

}  // namespace typhora
