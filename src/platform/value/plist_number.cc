#include "platform/value/plist_number.h"

#include <cmath>
#include <limits>

namespace typhora {

std::optional<std::int64_t> PlistNumber::integerValue(const Value& value) {
  constexpr std::int64_t kMax = std::numeric_limits<std::int64_t>::max();
  constexpr std::int64_t kMin = std::numeric_limits<std::int64_t>::min();
  constexpr double kTwoTo63 = 9223372036854775808.0;
  switch (value.type()) {
    case Value::Type::Bool:
      return *value.asBool() ? 1 : 0;
    case Value::Type::Int:
      return *value.asInt();
    case Value::Type::UInt:
      return kMax;  // only values above the signed range are stored unsigned
    case Value::Type::Double: {
      const double d = *value.asDouble();
      if (std::isnan(d)) return 0;
      if (d >= kTwoTo63) return kMax;
      if (d < -kTwoTo63) return kMin;
      return static_cast<std::int64_t>(d);
    }
    default:
      return std::nullopt;
  }
}

std::optional<bool> PlistNumber::boolValue(const Value& value) {
  if (std::optional<bool> b = value.asBool()) return b;
  if (!value.isNumber()) return std::nullopt;
  if (value.type() == Value::Type::Double) return *value.asDouble() != 0;
  return integerValue(value) != 0;
}

}  // namespace typhora
