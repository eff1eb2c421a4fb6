// JSON text form of Values, for hand-written files and the command-line tool.
// Data are {"$data": "<base64>"}, dates {"$date": "<RFC 3339>"}; endpoints have no JSON form.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/value.h"
#include "platform/value/value_codec.h"

namespace typhora {

class JsonCodec {
 public:
  // Compact when `pretty` is false; two-space indentation otherwise. Keys in dictionary order.
  // Endpoints are written as {"$endpoint": null}; they do not round-trip.
  static std::string encode(const Value& value, bool pretty = false);

  // nullopt on failure with `error` set. Integers that fit int64/uint64 become Int/UInt,
  // anything else a Double.
  static std::optional<Value> decode(std::string_view text, const DecodeLimits& limits = {},
                                     std::string* error = nullptr);
};

}  // namespace typhora
