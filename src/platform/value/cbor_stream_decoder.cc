// The reference CBOR decoder: libcbor's streaming decoder, with callbacks that build Values
// directly. It accepts every form the format allows (indefinite lengths, any head width) and words
// every refusal; the faster reader in CborCodec leaves to it whatever its scanner does not take.
#include "platform/value/cbor_stream_decoder.h"

#include <cbor.h>

#include <cmath>
#include <limits>

#include "platform/value/utf8.h"

namespace typhora {
namespace {

constexpr std::uint64_t kDateTag = 1;
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

std::optional<Value> CborStreamDecoder::decode(std::span<const std::uint8_t> input,
                                               const DecodeLimits& limits,
                                               const EndpointHooks* hooks, std::string* error) {
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
