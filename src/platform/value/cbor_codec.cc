// CBOR through libcbor's streaming encoder and decoder: Values are written and built directly,
// never through a second tree.
#include "platform/value/cbor_codec.h"

#include <cbor.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>

#include "platform/value/cbor_encoding_memo.h"
#include "platform/value/utf8.h"

namespace typhora {
namespace {

constexpr std::uint64_t kDateTag = 1;

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
std::size_t sizeBound(const Value& value, std::size_t depth) {
  if (depth > 256) return 0;  // the encoder refuses such depths anyway
  if (const Dictionary* dictionary = value.asDictionary()) {
    if (auto kept = keptEncoding(dictionary, dictionary->size())) return kept->size();
  } else if (const ValueArray* array = value.asArray()) {
    if (auto kept = keptEncoding(array, array->size())) return kept->size();
  }
  switch (value.type()) {
    case Value::Type::String:
      return 9 + value.asString()->size();
    case Value::Type::Data:
      return 9 + value.asData()->size();
    case Value::Type::Date:
      return 18;
    case Value::Type::Array: {
      std::size_t n = 9;
      for (const Value& item : *value.asArray()) n += sizeBound(item, depth + 1);
      return n;
    }
    case Value::Type::Dictionary: {
      std::size_t n = 9;
      for (const auto& [key, item] : *value.asDictionary()) {
        n += 9 + key.size() + sizeBound(item, depth + 1);
      }
      return n;
    }
    default:
      return 18;
  }
}

class Encoder {
 public:
  Encoder(Bytes* out, const EndpointHooks* hooks, std::string* error, std::size_t maxDepth)
      : out_(*out), hooks_(hooks), error_(error), maxDepth_(maxDepth) {}

  bool encode(const Value& value, std::size_t depth) {
    if (depth > maxDepth_) return fail("nesting deeper than the limit");
    deepest_ = std::max(deepest_, depth);
    switch (value.type()) {
      case Value::Type::Null:
        return put(cbor_encode_null);
      case Value::Type::Bool:
        return put(cbor_encode_bool, *value.asBool());
      case Value::Type::Int: {
        std::int64_t i = *value.asInt();
        if (i >= 0) return put(cbor_encode_uint, static_cast<std::uint64_t>(i));
        return put(cbor_encode_negint, static_cast<std::uint64_t>(-(i + 1)));
      }
      case Value::Type::UInt:
        return put(cbor_encode_uint, *value.asUInt());
      case Value::Type::Double:
        return put(cbor_encode_double, *value.asDouble());
      case Value::Type::String:
        return bytes(cbor_encode_string_start, *value.asString());
      case Value::Type::Data:
        return bytes(cbor_encode_bytestring_start, *value.asData());
      case Value::Type::Date:
        return put(cbor_encode_tag, kDateTag) &&
               put(cbor_encode_double, value.asDate()->secondsSince1970);
      case Value::Type::Array: {
        const ValueArray& array = *value.asArray();
        return shared(&array, array.size(), depth, [&] {
          if (!put(cbor_encode_array_start, array.size())) return false;
          for (const Value& item : array) {
            if (!encode(item, depth + 1)) return false;
          }
          return true;
        });
      }
      case Value::Type::Dictionary: {
        const Dictionary& dict = *value.asDictionary();
        return shared(&dict, dict.size(), depth, [&] {
          if (!put(cbor_encode_map_start, dict.size())) return false;
          for (const auto& [key, item] : dict) {
            if (!bytes(cbor_encode_string_start, key) || !encode(item, depth + 1)) return false;
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
  // An array or dictionary kept by the memo is copied from its kept encoding, and encoded (then
  // kept) by `walk` the first time. An encoding that placed endpoints is not kept: their indexes
  // belong to one message.
  template <class Walk>
  bool shared(const void* container, std::size_t items, std::size_t depth, const Walk& walk) {
    CborEncodingMemo::Encoding known;
    bool kept = false;
    if (auto bytes = keptEncoding(container, items, &known, &kept)) {
      if (depth + known.height > maxDepth_) return fail("nesting deeper than the limit");
      deepest_ = std::max(deepest_, depth + known.height);
      ensure(bytes->size());
      out_.insert(out_.end(), bytes->begin(), bytes->end());
      return true;
    }
    if (!kept) return walk();
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

  // Grows the buffer geometrically ahead of writes: resizing a byte vector a few bytes at a time
  // otherwise costs more than the encoding itself.
  void ensure(std::size_t more) {
    if (out_.capacity() - out_.size() < more) {
      out_.reserve(std::max(out_.capacity() * 2, out_.size() + more + 4096));
    }
  }

  template <class F, class... A>
  bool put(F encodeFn, A... args) {
    ensure(9);
    std::size_t at = out_.size();
    out_.resize(at + 9);
    std::size_t n = encodeFn(args..., out_.data() + at, 9);
    out_.resize(at + n);
    return n > 0 || fail("encoder failed");
  }

  template <class Container>
  bool bytes(std::size_t (*start)(std::size_t, unsigned char*, std::size_t),
             const Container& content) {
    if (!put(start, content.size())) return false;
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
    return put(cbor_encode_tag, kCborEndpointTag) && put(cbor_encode_uint, *index);
  }

  bool fail(const char* why) {
    if (error_ != nullptr) *error_ = why;
    return false;
  }

  Bytes& out_;
  const EndpointHooks* hooks_;
  std::string* error_;
  std::size_t maxDepth_;
  std::size_t deepest_ = 0;    // the deepest level encoded so far
  std::size_t endpoints_ = 0;  // endpoints met so far
};

// ---- Decoding ----

// One open container (or tag, or indefinite string) on the builder's stack.
struct Frame {
  enum class Kind { Array, Map, DateTag, EndpointTag, IndefiniteBytes, IndefiniteText };
  Kind kind = Kind::Array;
  bool indefinite = false;
  std::size_t remaining = 0;  // items still expected (maps count keys and values)
  ValueArray items;
  std::vector<DictionaryEntry> entries;
  std::optional<std::string> key;
  std::string chunks;
};

class Builder {
 public:
  Builder(const DecodeLimits& limits, const EndpointHooks* hooks)
      : limits_(limits), hooks_(hooks) {}

  bool failed() const { return !error_.empty(); }
  void setInputLeft(std::size_t bytes) { inputLeft_ = bytes; }
  const std::string& error() const { return error_; }
  bool complete() const { return done_ && stack_.empty(); }
  Value take() { return std::move(result_); }

  void fail(std::string why) {
    if (error_.empty()) error_ = std::move(why);
  }

  // A finished item: goes into the open container, or becomes the result.
  void emit(Value value) {
    if (failed()) return;
    if (done_) return fail("more than one top-level item");
    if (++items_ > limits_.maxItems) return fail("too many items");
    if (stack_.empty()) {
      result_ = std::move(value);
      done_ = true;
      return;
    }
    Frame& top = stack_.back();
    switch (top.kind) {
      case Frame::Kind::Array:
        top.items.push_back(std::move(value));
        break;
      case Frame::Kind::Map:
        if (!top.key) {
          const std::string* key = value.asString();
          if (key == nullptr) return fail("a dictionary key that is not a string");
          top.key = *key;
        } else {
          top.entries.emplace_back(std::move(*top.key), std::move(value));
          top.key.reset();
        }
        break;
      case Frame::Kind::DateTag:
        return closeTag(std::move(value));
      case Frame::Kind::EndpointTag:
        return closeTag(std::move(value));
      case Frame::Kind::IndefiniteBytes:
      case Frame::Kind::IndefiniteText:
        return fail("an indefinite string holding something other than chunks");
    }
    if (!top.indefinite && --top.remaining == 0) closeContainer();
  }

  void open(Frame::Kind kind, std::optional<std::size_t> count) {
    if (failed()) return;
    if (done_) return fail("more than one top-level item");
    if (stack_.size() >= limits_.maxDepth) return fail("nesting deeper than the limit");
    Frame frame;
    frame.kind = kind;
    frame.indefinite = !count.has_value();
    frame.remaining = count.value_or(0);
    if (kind == Frame::Kind::Map && count) {
      if (*count > std::numeric_limits<std::size_t>::max() / 2) return fail("map too large");
      frame.remaining = *count * 2;
    }
    if (!frame.indefinite && frame.remaining > limits_.maxItems) return fail("too many items");
    // Reserve what a definite container declares, but never more than the unread input could
    // hold: a declared length alone must not make the decoder allocate.
    if (!frame.indefinite && count) {
      const std::size_t plausible = std::min(*count, inputLeft_);
      if (kind == Frame::Kind::Array) frame.items.reserve(plausible);
      if (kind == Frame::Kind::Map) frame.entries.reserve(plausible);
    }
    const bool empty = !frame.indefinite && frame.remaining == 0;
    if (kind == Frame::Kind::DateTag || kind == Frame::Kind::EndpointTag) frame.remaining = 1;
    stack_.push_back(std::move(frame));
    if (empty && (kind == Frame::Kind::Array || kind == Frame::Kind::Map)) closeContainer();
  }

  void chunk(cbor_data data, std::size_t length, bool text) {
    if (failed()) return;
    if (text && !isValidUtf8(std::string_view(reinterpret_cast<const char*>(data), length))) {
      return fail("a string that is not valid UTF-8");
    }
    if (!stack_.empty()) {
      Frame& top = stack_.back();
      bool bytesFrame = top.kind == Frame::Kind::IndefiniteBytes;
      bool textFrame = top.kind == Frame::Kind::IndefiniteText;
      if (bytesFrame || textFrame) {
        if (bytesFrame == text) return fail("a chunk of the wrong kind in an indefinite string");
        top.chunks.append(reinterpret_cast<const char*>(data), length);
        return;
      }
    }
    if (text && awaitingKey()) {
      takeKey(std::string(reinterpret_cast<const char*>(data), length));
    } else if (text) {
      emit(Value(std::string(reinterpret_cast<const char*>(data), length)));
    } else {
      emit(Value(Bytes(data, data + length)));
    }
  }

  void indefiniteBreak() {
    if (failed()) return;
    if (stack_.empty() || !stack_.back().indefinite) return fail("an unexpected break");
    Frame& top = stack_.back();
    if (top.kind == Frame::Kind::Map && top.key) return fail("a dictionary key without a value");
    if (top.kind == Frame::Kind::IndefiniteBytes || top.kind == Frame::Kind::IndefiniteText) {
      Frame frame = std::move(top);
      stack_.pop_back();
      if (frame.kind == Frame::Kind::IndefiniteText) return emit(Value(std::move(frame.chunks)));
      return emit(Value(Bytes(frame.chunks.begin(), frame.chunks.end())));
    }
    closeContainer();
  }

  void tag(std::uint64_t value) {
    if (value == kDateTag) return open(Frame::Kind::DateTag, 1);
    if (value == kCborEndpointTag) return open(Frame::Kind::EndpointTag, 1);
    fail("an unsupported tag " + std::to_string(value));
  }

  void integer(std::uint64_t u) { emit(Value(u)); }
  void negative(std::uint64_t n) {
    if (n > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
      return fail("a negative integer below the 64-bit range");
    }
    emit(Value(-1 - static_cast<std::int64_t>(n)));
  }

 private:
  bool awaitingKey() const {
    return !done_ && !stack_.empty() && stack_.back().kind == Frame::Kind::Map &&
           !stack_.back().key;
  }

  // A dictionary key goes straight to its map, never through a Value.
  void takeKey(std::string key) {
    if (++items_ > limits_.maxItems) return fail("too many items");
    Frame& top = stack_.back();
    top.key = std::move(key);
    if (!top.indefinite) --top.remaining;  // never the last item: a value follows
  }

  void closeContainer() {
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    if (frame.kind == Frame::Kind::Array) return emit(Value(std::move(frame.items)));
    emit(Value(Dictionary(std::move(frame.entries))));
  }

  void closeTag(Value content) {
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    if (frame.kind == Frame::Kind::DateTag) {
      std::optional<double> seconds = content.asDouble();
      if (!seconds || !std::isfinite(*seconds)) return fail("a date that is not a finite number");
      return emit(Value(Date{*seconds}));
    }
    std::optional<std::uint64_t> index = content.asUInt();
    if (!index) return fail("an endpoint whose index is not an unsigned integer");
    if (hooks_ == nullptr || !hooks_->fromIndex) return fail("an endpoint where none may be");
    std::shared_ptr<const IpcEndpoint> endpoint = hooks_->fromIndex(*index);
    if (!endpoint) return fail("an endpoint index with no descriptor");
    emit(Value(std::move(endpoint)));
  }

  const DecodeLimits& limits_;
  const EndpointHooks* hooks_;
  std::size_t inputLeft_ = 0;
  std::vector<Frame> stack_;
  std::size_t items_ = 0;
  bool done_ = false;
  Value result_;
  std::string error_;
};

Builder& of(void* context) {
  return *static_cast<Builder*>(context);
}

const cbor_callbacks& callbacks() {
  static const cbor_callbacks table = [] {
    cbor_callbacks c = cbor_empty_callbacks;
    c.uint8 = [](void* ctx, uint8_t v) { of(ctx).integer(v); };
    c.uint16 = [](void* ctx, uint16_t v) { of(ctx).integer(v); };
    c.uint32 = [](void* ctx, uint32_t v) { of(ctx).integer(v); };
    c.uint64 = [](void* ctx, uint64_t v) { of(ctx).integer(v); };
    c.negint8 = [](void* ctx, uint8_t v) { of(ctx).negative(v); };
    c.negint16 = [](void* ctx, uint16_t v) { of(ctx).negative(v); };
    c.negint32 = [](void* ctx, uint32_t v) { of(ctx).negative(v); };
    c.negint64 = [](void* ctx, uint64_t v) { of(ctx).negative(v); };
    c.byte_string = [](void* ctx, cbor_data d, size_t n) { of(ctx).chunk(d, n, false); };
    c.byte_string_start = [](void* ctx) { of(ctx).open(Frame::Kind::IndefiniteBytes, {}); };
    c.string = [](void* ctx, cbor_data d, size_t n) { of(ctx).chunk(d, n, true); };
    c.string_start = [](void* ctx) { of(ctx).open(Frame::Kind::IndefiniteText, {}); };
    c.array_start = [](void* ctx, size_t n) { of(ctx).open(Frame::Kind::Array, n); };
    c.indef_array_start = [](void* ctx) { of(ctx).open(Frame::Kind::Array, {}); };
    c.map_start = [](void* ctx, size_t n) { of(ctx).open(Frame::Kind::Map, n); };
    c.indef_map_start = [](void* ctx) { of(ctx).open(Frame::Kind::Map, {}); };
    c.tag = [](void* ctx, uint64_t v) { of(ctx).tag(v); };
    c.float2 = [](void* ctx, float v) { of(ctx).emit(Value(static_cast<double>(v))); };
    c.float4 = [](void* ctx, float v) { of(ctx).emit(Value(static_cast<double>(v))); };
    c.float8 = [](void* ctx, double v) { of(ctx).emit(Value(v)); };
    c.null = [](void* ctx) { of(ctx).emit(Value()); };
    c.undefined = [](void* ctx) { of(ctx).fail("an undefined value"); };
    c.boolean = [](void* ctx, bool v) { of(ctx).emit(Value(v)); };
    c.indef_break = [](void* ctx) { of(ctx).indefiniteBreak(); };
    return c;
  }();
  return table;
}

}  // namespace

bool CborCodec::encode(const Value& value, Bytes* out, const EndpointHooks* hooks,
                       std::string* error, std::size_t maxDepth) {
  const std::size_t start = out->size();
  out->reserve(start + sizeBound(value, 0));
  Encoder encoder(out, hooks, error, maxDepth);
  if (encoder.encode(value, 0)) return true;
  out->resize(start);
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
  auto failWith = [error](std::string why) -> std::optional<Value> {
    if (error != nullptr) *error = std::move(why);
    return std::nullopt;
  };
  if (input.size() > limits.maxBytes) return failWith("input larger than the size limit");
  if (input.empty()) return failWith("empty input");
  Builder builder(limits, hooks);
  std::size_t offset = 0;
  while (offset < input.size() && !builder.failed() && !builder.complete()) {
    builder.setInputLeft(input.size() - offset);
    cbor_decoder_result r =
        cbor_stream_decode(input.data() + offset, input.size() - offset, &callbacks(), &builder);
    if (r.status == CBOR_DECODER_NEDATA) {
      return failWith("truncated input at byte " + std::to_string(offset));
    }
    if (r.status != CBOR_DECODER_FINISHED || r.read == 0) {
      return failWith("malformed item at byte " + std::to_string(offset));
    }
    offset += r.read;
  }
  if (builder.failed()) {
    return failWith(builder.error() + " (before byte " + std::to_string(offset) + ")");
  }
  if (!builder.complete()) return failWith("truncated input at byte " + std::to_string(offset));
  if (offset != input.size()) {
    return failWith("trailing bytes after the item at byte " + std::to_string(offset));
  }
  return builder.take();
}

}  // namespace typhora
