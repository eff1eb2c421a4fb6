// CBOR written straight from Values (shortest heads, doubles in eight bytes), never through a
// second tree: a per-item library call cost more than the encoding itself.
// Decoding is a validating scan and a reader of what it took; anything else goes to libcbor's
// streaming decoder (CborStreamDecoder).
#include "platform/value/cbor_codec.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>

#include "platform/value/cbor_encoding_memo.h"
#include "platform/value/cbor_reader.h"
#include "platform/value/cbor_scanner.h"
#include "platform/value/cbor_stream_decoder.h"
#include "platform/value/lazy_container.h"

namespace typhora {
namespace {

constexpr std::uint64_t kDateTag = 1;
// Major types.
constexpr std::uint8_t kUnsigned = 0;
constexpr std::uint8_t kNegative = 1;
constexpr std::uint8_t kByteString = 2;
constexpr std::uint8_t kText = 3;
constexpr std::uint8_t kArray = 4;
constexpr std::uint8_t kMap = 5;
constexpr std::uint8_t kTag = 6;

// ---- Encoding ----

// The kept encoding of a large shared array or dictionary, or null.
std::shared_ptr<const Bytes> keptEncoding(const void* container, std::size_t items,
                                          CborEncodingMemo::Encoding* known = nullptr,
                                          bool* kept = nullptr) {
  if (items < CborEncodingMemo::kMinimumItems) return nullptr;
  CborEncodingMemo::Encoding found;
  const bool isKept = CborEncodingMemo::shared().find(container, &found);
  if (kept != nullptr) *kept = isKept;
  if (known != nullptr) *known = found;
  return found.bytes;
}

// An upper bound of the encoded size (9 bytes covers any head), so that the output buffer is
// allocated once: growing a multi-megabyte buffer step by step costs more than encoding it.
std::size_t sizeBound(const Value& value, std::size_t depth, bool splicing) {
  if (depth > 256) return 0;  // the encoder refuses such depths anyway
  if (const LazyContainer* lazy = value.lazyContainer()) return lazy->encoding().size();
  // A kept container takes its kept size, or none when it will be spliced (or first encoded
  // apart, to be spliced).
  auto keptSize = [splicing](const void* container,
                             std::size_t items) -> std::optional<std::size_t> {
    CborEncodingMemo::Encoding known;
    bool kept = false;
    const std::shared_ptr<const Bytes> bytes = keptEncoding(container, items, &known, &kept);
    if (splicing && kept && (!bytes || bytes->size() >= CborCodec::kSpliceBytes)) return 0;
    if (bytes) return bytes->size();
    return std::nullopt;
  };
  std::optional<std::size_t> kept;
  if (const Dictionary* dictionary = value.asDictionary()) {
    kept = keptSize(dictionary, dictionary->size());
  } else if (const ValueArray* array = value.asArray()) {
    kept = keptSize(array, array->size());
  }
  if (kept) return *kept;
  switch (value.type()) {
    case Value::Type::String:
      return 9 + value.asString()->size();
    case Value::Type::Data:
      return 9 + value.asData()->size();
    case Value::Type::Date:
      return 18;
    case Value::Type::Array: {
      std::size_t n = 9;
      for (const Value& item : *value.asArray()) n += sizeBound(item, depth + 1, splicing);
      return n;
    }
    case Value::Type::Dictionary: {
      std::size_t n = 9;
      for (const auto& [key, item] : *value.asDictionary()) {
        n += 9 + key.size() + sizeBound(item, depth + 1, splicing);
      }
      return n;
    }
    default:
      return 18;
  }
}

class Encoder {
 public:
  Encoder(Bytes* out, const EndpointHooks* hooks, std::string* error, std::size_t maxDepth,
          std::vector<CborSplice>* splices)
      : out_(*out), hooks_(hooks), error_(error), maxDepth_(maxDepth), splices_(splices) {}

  bool encode(const Value& value, std::size_t depth) {
    if (depth > maxDepth_) return fail("nesting deeper than the limit");
    deepest_ = std::max(deepest_, depth);
    if (const LazyContainer* lazy = value.lazyContainer()) return copy(*lazy, depth);
    switch (value.type()) {
      case Value::Type::Null:
        return simple(0xf6);
      case Value::Type::Bool:
        return simple(*value.asBool() ? 0xf5 : 0xf4);
      case Value::Type::Int: {
        std::int64_t i = *value.asInt();
        if (i >= 0) return head(kUnsigned, static_cast<std::uint64_t>(i));
        return head(kNegative, static_cast<std::uint64_t>(-(i + 1)));
      }
      case Value::Type::UInt:
        return head(kUnsigned, *value.asUInt());
      case Value::Type::Double:
        return real(*value.asDouble());
      case Value::Type::String:
        return bytes(kText, *value.asString());
      case Value::Type::Data:
        return bytes(kByteString, *value.asData());
      case Value::Type::Date:
        return head(kTag, kDateTag) && real(value.asDate()->secondsSince1970);
      case Value::Type::Array: {
        const ValueArray& array = *value.asArray();
        return shared(value, &array, array.size(), depth, [&] {
          if (!head(kArray, array.size())) return false;
          for (const Value& item : array) {
            if (!encode(item, depth + 1)) return false;
          }
          return true;
        });
      }
      case Value::Type::Dictionary: {
        const Dictionary& dict = *value.asDictionary();
        return shared(value, &dict, dict.size(), depth, [&] {
          if (!head(kMap, dict.size())) return false;
          for (const auto& [key, item] : dict) {
            if (!bytes(kText, key) || !encode(item, depth + 1)) return false;
          }
          return true;
        });
      }
      case Value::Type::Endpoint:
        return endpoint(*value.asEndpoint());
    }
    return fail("unknown value type");
  }

 private:
  // A container still encoded is copied: its bytes are what the walk would write.
  bool copy(const LazyContainer& lazy, std::size_t depth) {
    if (depth + lazy.height() > maxDepth_) return fail("nesting deeper than the limit");
    deepest_ = std::max(deepest_, depth + lazy.height());
    const std::span<const std::uint8_t> bytes = lazy.encoding();
    ensure(bytes.size());
    out_.insert(out_.end(), bytes.begin(), bytes.end());
    return true;
  }

  // An array or dictionary kept by the memo is copied (or spliced) from its kept encoding, and
  // encoded (then kept) by `walk` the first time. An encoding that placed endpoints is not kept:
  // their indexes belong to one message.
  template <class Walk>
  bool shared(const Value& value, const void* container, std::size_t items, std::size_t depth,
              const Walk& walk) {
    if (container == apart_) return walk();
    CborEncodingMemo::Encoding known;
    bool kept = false;
    if (auto bytes = keptEncoding(container, items, &known, &kept)) {
      if (depth + known.height > maxDepth_) return fail("nesting deeper than the limit");
      deepest_ = std::max(deepest_, depth + known.height);
      if (splices_ != nullptr && bytes->size() >= CborCodec::kSpliceBytes) {
        splices_->push_back({out_.size(), std::move(bytes)});
        return true;
      }
      ensure(bytes->size());
      out_.insert(out_.end(), bytes->begin(), bytes->end());
      return true;
    }
    if (!kept) return walk();
    if (splices_ != nullptr) return encodeApart(value, container, depth);
    const std::size_t start = out_.size();
    const std::size_t endpointsBefore = endpoints_;
    const std::size_t deepestBefore = deepest_;
    deepest_ = depth;
    const bool ok = walk();
    const std::size_t height = deepest_ - depth;
    deepest_ = std::max(deepest_, deepestBefore);
    if (ok && endpoints_ == endpointsBefore) {
      CborEncodingMemo::shared().store(
          container, {std::make_shared<const Bytes>(
                          out_.begin() + static_cast<std::ptrdiff_t>(start), out_.end()),
                      height});
    }
    return ok;
  }

  // A kept container met unencoded while splicing: encoded into a buffer of its own, which the
  // memo keeps and the output splices, neither copying it.
  bool encodeApart(const Value& value, const void* container, std::size_t depth) {
    auto own = std::make_shared<Bytes>();
    own->reserve(sizeBound(value, depth, false));
    Encoder apart(own.get(), hooks_, error_, maxDepth_, nullptr);
    apart.apart_ = container;
    apart.deepest_ = depth;
    apart.endpoints_ = endpoints_;  // indexes go on from this message's
    if (!apart.encode(value, depth)) return false;
    const std::size_t height = apart.deepest_ - depth;
    deepest_ = std::max(deepest_, apart.deepest_);
    const bool placedEndpoints = apart.endpoints_ != endpoints_;
    endpoints_ = apart.endpoints_;
    if (!placedEndpoints) CborEncodingMemo::shared().store(container, {own, height});
    if (own->size() >= CborCodec::kSpliceBytes) {
      splices_->push_back({out_.size(), std::move(own)});
      return true;
    }
    ensure(own->size());
    out_.insert(out_.end(), own->begin(), own->end());
    return true;
  }

  // Grows the buffer geometrically ahead of writes: resizing a byte vector a few bytes at a time
  // otherwise costs more than the encoding itself.
  void ensure(std::size_t more) {
    if (out_.capacity() - out_.size() < more) {
      out_.reserve(std::max(out_.capacity() * 2, out_.size() + more + 4096));
    }
  }

  // A head in its shortest form: the major type and its argument, big-endian.
  bool head(std::uint8_t major, std::uint64_t argument) {
    std::uint8_t bytes[9];
    std::size_t size = 1;
    if (argument < 24) {
      bytes[0] = static_cast<std::uint8_t>(major << 5 | argument);
    } else {
      const int width = argument <= 0xff         ? 1
                        : argument <= 0xffff     ? 2
                        : argument <= 0xffffffff ? 4
                                                 : 8;
      bytes[0] = static_cast<std::uint8_t>(major << 5 | (width == 1   ? 24
                                                         : width == 2 ? 25
                                                         : width == 4 ? 26
                                                                      : 27));
      for (int i = width; i > 0; --i, argument >>= 8)
        bytes[i] = static_cast<std::uint8_t>(argument);
      size += static_cast<std::size_t>(width);
    }
    ensure(size);
    out_.insert(out_.end(), bytes, bytes + size);
    return true;
  }

  bool simple(std::uint8_t initial) {
    ensure(1);
    out_.push_back(initial);
    return true;
  }

  // Doubles always in eight bytes, as decoders of this system expect them.
  bool real(double value) {
    std::uint64_t bits = 0;
    std::memcpy(&bits, &value, sizeof bits);
    std::uint8_t bytes[9] = {0xfb};
    for (int i = 8; i > 0; --i, bits >>= 8) bytes[i] = static_cast<std::uint8_t>(bits);
    ensure(sizeof bytes);
    out_.insert(out_.end(), bytes, bytes + sizeof bytes);
    return true;
  }

  template <class Container>
  bool bytes(std::uint8_t major, const Container& content) {
    head(major, content.size());
    ensure(content.size());
    out_.insert(out_.end(), reinterpret_cast<const std::uint8_t*>(content.data()),
                reinterpret_cast<const std::uint8_t*>(content.data()) + content.size());
    return true;
  }

  bool endpoint(const std::shared_ptr<const IpcEndpoint>& ep) {
    ++endpoints_;
    if (hooks_ == nullptr || !hooks_->toIndex) return fail("an endpoint cannot be encoded here");
    std::optional<std::uint64_t> index = hooks_->toIndex(ep);
    if (!index) return fail("the endpoint could not be passed");
    return head(kTag, kCborEndpointTag) && head(kUnsigned, *index);
  }

  bool fail(const char* why) {
    if (error_ != nullptr) *error_ = why;
    return false;
  }

  Bytes& out_;
  const EndpointHooks* hooks_;
  std::string* error_;
  std::size_t maxDepth_;
  std::vector<CborSplice>* splices_;
  const void* apart_ = nullptr;  // the container this encoder encodes apart: walked, not kept
  std::size_t deepest_ = 0;      // the deepest level encoded so far
  std::size_t endpoints_ = 0;    // endpoints met so far
};

}  // namespace

bool CborCodec::encode(const Value& value, Bytes* out, const EndpointHooks* hooks,
                       std::string* error, std::size_t maxDepth, std::vector<CborSplice>* splices) {
  const std::size_t start = out->size();
  const std::size_t splicesBefore = splices != nullptr ? splices->size() : 0;
  out->reserve(start + sizeBound(value, 0, splices != nullptr));
  Encoder encoder(out, hooks, error, maxDepth, splices);
  if (encoder.encode(value, 0)) return true;
  out->resize(start);
  if (splices != nullptr) splices->resize(splicesBefore);
  return false;
}

Bytes CborCodec::encode(const Value& value) {
  Bytes out;
  encode(value, &out);
  return out;
}

std::optional<Value> CborCodec::decode(std::span<const std::uint8_t> input,
                                       const DecodeLimits& limits, const EndpointHooks* hooks,
                                       std::string* error) {
  return decodeLazily(nullptr, input, limits, hooks, error);
}

std::optional<Value> CborCodec::decodeLazily(std::shared_ptr<const void> owner,
                                             std::span<const std::uint8_t> input,
                                             const DecodeLimits& limits, const EndpointHooks* hooks,
                                             std::string* error, std::size_t lazyBytes) {
  const bool endpoints = hooks != nullptr && hooks->fromIndex;
  std::vector<CborScanner::Container> lazy;
  if (CborScanner::scan(input, limits, endpoints, owner ? std::max<std::size_t>(lazyBytes, 1) : 0,
                        &lazy)) {
    std::shared_ptr<CborReader::Source> source;
    if (!lazy.empty()) {
      source = std::make_shared<CborReader::Source>(
          CborReader::Source{std::move(owner), input, std::move(lazy)});
    }
    if (auto value = CborReader::read(input, source, hooks)) return value;
  }
  // Unusual forms, and every refusal with its reason.
  return CborStreamDecoder::decode(input, limits, hooks, error);
}
}  // namespace typhora
