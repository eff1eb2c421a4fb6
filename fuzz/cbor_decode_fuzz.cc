// CBOR decoding of untrusted bytes: never a crash; what decodes re-encodes to the same value.
#include <cstdint>
#include <cstdlib>

#include "platform/value/cbor_codec.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  typhora::DecodeLimits limits;
  limits.maxBytes = 1 << 20;
  limits.maxDepth = 32;
  limits.maxItems = 1 << 16;
  auto value = typhora::CborCodec::decode({data, size}, limits);
  if (!value) return 0;
  auto again = typhora::CborCodec::decode(typhora::CborCodec::encode(*value), limits);
  if (!again || !(*again == *value)) std::abort();
  return 0;
}
