// CBOR (RFC 8949) encoding of Values: the wire and file format.
// Dates are tag 1 with a double; data are byte strings; endpoints use kCborEndpointTag.
#pragma once

#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/value/value.h"
#include "platform/value/value_codec.h"

namespace typhora {

// A kept encoding left out of an output buffer: its bytes belong before the byte at `at`.
struct CborSplice {
  std::size_t at = 0;
  std::shared_ptr<const Bytes> bytes;
};

class CborCodec {
 public:
  // Kept encodings of at least this many bytes are spliced rather than copied.
  static constexpr std::size_t kSpliceBytes = 64 * 1024;

  // Appends the encoding of `value` to `out`. Fails (false, with `error` set when given) only for
  // an endpoint that the hooks cannot place, or for nesting deeper than `maxDepth`. With
  // `splices`, large kept encodings (the user-fonts records every enumerating client receives)
  // are not copied into `out` but listed there, in order, for a writer that gathers its pieces.
  static bool encode(const Value& value, Bytes* out, const EndpointHooks* hooks = nullptr,
                     std::string* error = nullptr, std::size_t maxDepth = 64,
                     std::vector<CborSplice>* splices = nullptr);
  static Bytes encode(const Value& value);  // no endpoints; never fails for other values

  // Decodes exactly one item filling all of `input`. nullopt on failure, with `error` telling
  // what was wrong and where. A CBOR null decodes to a null Value (not a failure).
  static std::optional<Value> decode(std::span<const std::uint8_t> input,
                                     const DecodeLimits& limits = {},
                                     const EndpointHooks* hooks = nullptr,
                                     std::string* error = nullptr);

  // Arrays and dictionaries of at least this many encoded bytes may stay encoded.
  static constexpr std::size_t kLazyBytes = 4096;
  // As decode, and refusing the same inputs up front, but arrays and dictionaries of at least
  // `lazyBytes` bytes, already encoded as the encoder writes them and holding no endpoint, stay
  // encoded until first opened, keeping `owner` (which holds `input`) alive: any part still
  // encoded keeps all of `input` in memory. Opening one never fails; encoding one copies its
  // bytes. Without an owner, as decode.
  static std::optional<Value> decodeLazily(std::shared_ptr<const void> owner,
                                           std::span<const std::uint8_t> input,
                                           const DecodeLimits& limits = {},
                                           const EndpointHooks* hooks = nullptr,
                                           std::string* error = nullptr,
                                           std::size_t lazyBytes = kLazyBytes);
};

}  // namespace typhora
