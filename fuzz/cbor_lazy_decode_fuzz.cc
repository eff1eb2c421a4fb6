// The fast and the lazy CBOR decoders against the stream decoder, on untrusted bytes: the same
// acceptance, the same reason for a refusal, the same value and the same encoding; a value left
// encoded opens without fault. Every container that may stay encoded does, however small.
#include <cstdint>
#include <cstdlib>
#include <memory>

#include "platform/value/cbor_codec.h"
#include "platform/value/cbor_stream_decoder.h"

namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using typhora::CborCodec;
  typhora::DecodeLimits limits;
  limits.maxBytes = 1 << 20;
  limits.maxDepth = 16;
  limits.maxItems = 1 << 12;
  std::string referenceError;
  std::string fastError;
  std::string lazyError;
  const auto reference =
      typhora::CborStreamDecoder::decode({data, size}, limits, nullptr, &referenceError);
  const auto fast = CborCodec::decode({data, size}, limits, nullptr, &fastError);
  auto owner = std::make_shared<const typhora::Bytes>(data, data + size);
  const auto lazy = CborCodec::decodeLazily(owner, *owner, limits, nullptr, &lazyError, 1);
  owner.reset();
  require(reference.has_value() == fast.has_value() && reference.has_value() == lazy.has_value());
  if (!reference) {
    require(fastError == referenceError && lazyError == referenceError);
    return 0;
  }
  // Encoding first copies what the lazy value still holds encoded; comparing opens all of it.
  const typhora::Bytes encoded = CborCodec::encode(*reference);
  require(CborCodec::encode(*lazy) == encoded && CborCodec::encode(*fast) == encoded);
  require(*fast == *reference && *lazy == *reference && *reference == *lazy);
  return 0;
}
