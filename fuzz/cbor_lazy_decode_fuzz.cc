// The fast and the lazy CBOR decoders against the stream decoder, on untrusted bytes: the same
// acceptance, the same reason for a refusal, the same value and the same encoding; a value left
// encoded opens without fault. Every container that may stay encoded does, however small.
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <vector>

#include "platform/ipc/ipc_endpoint.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/cbor_stream_decoder.h"

namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

class FuzzEndpoint final : public typhora::IpcEndpoint {
 public:
  std::string description() const override { return "fuzz"; }
};

// Descriptors 0 and 1 exist; any other index has none. Odd-sized inputs decode without hooks.
const typhora::EndpointHooks* hooksFor(std::size_t size) {
  static const auto* hooks = [] {
    auto* h = new typhora::EndpointHooks();
    static const std::shared_ptr<const typhora::IpcEndpoint> endpoints[] = {
        std::make_shared<FuzzEndpoint>(), std::make_shared<FuzzEndpoint>()};
    h->fromIndex = [](std::uint64_t index) -> std::shared_ptr<const typhora::IpcEndpoint> {
      return index < 2 ? endpoints[index] : nullptr;
    };
    h->toIndex = [](const std::shared_ptr<const typhora::IpcEndpoint>& endpoint)
        -> std::optional<std::uint64_t> { return endpoint == endpoints[0] ? 0 : 1; };
    return h;
  }();
  return size % 2 == 0 ? hooks : nullptr;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using typhora::CborCodec;
  typhora::DecodeLimits limits;
  limits.maxBytes = 1 << 20;
  limits.maxDepth = 16;
  limits.maxItems = 1 << 12;
  const typhora::EndpointHooks* hooks = hooksFor(size);
  std::string referenceError;
  std::string fastError;
  std::string lazyError;
  const auto reference =
      typhora::CborStreamDecoder::decode({data, size}, limits, hooks, &referenceError);
  const auto fast = CborCodec::decode({data, size}, limits, hooks, &fastError);
  auto owner = std::make_shared<const typhora::Bytes>(data, data + size);
  const auto lazy = CborCodec::decodeLazily(owner, *owner, limits, hooks, &lazyError, 1);
  owner.reset();
  require(reference.has_value() == fast.has_value() && reference.has_value() == lazy.has_value());
  if (!reference) {
    require(fastError == referenceError && lazyError == referenceError);
    return 0;
  }
  // A field read alone from a dictionary still encoded is the field built, at the top and one
  // level down, before anything opens them.
  for (const auto& [key, item] : reference->asDictionary() != nullptr
                                     ? reference->asDictionary()->entries()
                                     : std::vector<typhora::DictionaryEntry>{}) {
    const typhora::Value field = lazy->peek(key);
    if (const typhora::Dictionary* inner = item.asDictionary()) {
      for (const auto& [innerKey, innerItem] : *inner) require(field.peek(innerKey) == innerItem);
    }
    require(field == item);
  }
  require(lazy->peek("\xff not a key").isNull());
  // Encoding first copies what the lazy value still holds encoded; comparing opens all of it.
  auto encode = [hooks](const typhora::Value& value) {
    typhora::Bytes out;
    require(CborCodec::encode(value, &out, hooks));
    return out;
  };
  const typhora::Bytes encoded = encode(*reference);
  require(encode(*lazy) == encoded && encode(*fast) == encoded);
  require(*fast == *reference && *lazy == *reference && *reference == *lazy);
  return 0;
}
