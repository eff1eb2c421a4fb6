// CBOR decoding through libcbor's streaming decoder: the complete decoder, for every form the
// format allows, and the one that words refusals.
#pragma once

#include <optional>
#include <span>
#include <string>

#include "platform/value/value.h"
#include "platform/value/value_codec.h"

namespace typhora {

class CborStreamDecoder {
 public:
  // As CborCodec::decode, always building every value.
  static std::optional<Value> decode(std::span<const std::uint8_t> input,
                                     const DecodeLimits& limits, const EndpointHooks* hooks,
                                     std::string* error);
};

}  // namespace typhora
