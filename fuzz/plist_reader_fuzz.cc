// The property-list reader as every file reader uses it: format detection, then CBOR or JSON.
// Whatever decodes must encode, decode and encode again to the same bytes.
#include <cstdint>

#include "platform/value/cbor_codec.h"
#include "platform/value/plist_reader.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string error;
  std::optional<typhora::Value> value = typhora::PlistReader::read({data, size}, {}, &error);
  if (!value) return 0;
  const typhora::Bytes again = typhora::CborCodec::encode(*value);
  std::optional<typhora::Value> back = typhora::CborCodec::decode(again, {}, nullptr, &error);
  if (!back || typhora::CborCodec::encode(*back) != again) __builtin_trap();
  return 0;
}
