// JSON decoding of untrusted text: never a crash; what decodes re-encodes to text that reads
// back to the same text (dates with long fractions are not bit-exact through text).
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/value/json_codec.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  typhora::DecodeLimits limits;
  limits.maxBytes = 1 << 20;
  limits.maxDepth = 32;
  limits.maxItems = 1 << 16;
  std::string_view text(reinterpret_cast<const char*>(data), size);
  auto value = typhora::JsonCodec::decode(text, limits);
  if (!value) return 0;
  const std::string once = typhora::JsonCodec::encode(*value);
  auto again = typhora::JsonCodec::decode(once, limits);
  if (!again || typhora::JsonCodec::encode(*again) != once) std::abort();
  return 0;
}
