// Numbers read the way property-list readers read them, whatever their stored type: a boolean is
// 0 or 1, a double is truncated toward zero, and nothing overflows.
#pragma once

#include <cstdint>
#include <optional>

#include "platform/value/value.h"

namespace typhora {

class PlistNumber {
 public:
  // The value as an integer: booleans 0 and 1, doubles truncated toward zero and saturated at
  // the 64-bit bounds (NaN is 0), unsigned values above the signed range saturated. nullopt for
  // anything that is not a number or a boolean.
  static std::optional<std::int64_t> integerValue(const Value& value);
  // True for true and for any number other than 0; nullopt for anything else.
  static std::optional<bool> boolValue(const Value& value);
};

}  // namespace typhora
