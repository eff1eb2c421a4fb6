#include "platform/linux/lumo/transport/lumo_frame.h"

#include <cstring>

#include "platform/value/cbor_codec.h"

namespace typhora {
namespace {

void putU32(std::uint8_t* at, std::uint32_t v) {
  for (int i = 0; i < 4; ++i) at[i] = static_cast<std::uint8_t>(v >> (8 * i));
}
std::uint32_t getU32(const std::uint8_t* at) {
  std::uint32_t v = 0;
  for (int i = 3; i >= 0; --i) v = (v << 8) | at[i];
  return v;
}

// Reads one CBOR unsigned integer (major type 0) at `*at`, advancing it.
std::optional<std::uint64_t> peekUnsigned(std::span<const std::uint8_t> bytes, std::size_t* at) {
  if (*at >= bytes.size() || (bytes[*at] >> 5) != 0) return std::nullopt;
  const std::uint8_t info = bytes[(*at)++] & 0x1f;
  if (info < 24) return info;
  if (info > 27) return std::nullopt;
  const std::size_t width = std::size_t{1} << (info - 24);
  if (bytes.size() - *at < width) return std::nullopt;
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i) value = (value << 8) | bytes[(*at)++];
  return value;
}

}  // namespace

bool encodeLumoFrame(const LumoMessage& message, std::vector<std::uint8_t>* frame,
                     std::vector<int>* fds,
                     const std::function<int(const std::shared_ptr<const IpcEndpoint>&)>& fdOf,
                     std::string* error, const LumoLimits& limits,
                     std::vector<CborSplice>* splices) {
  EndpointHooks hooks;
  hooks.toIndex =
      [&](const std::shared_ptr<const IpcEndpoint>& ep) -> std::optional<std::uint64_t> {
    int fd = fdOf ? fdOf(ep) : -1;
    if (fd < 0 || fds->size() >= limits.maxDescriptors) return std::nullopt;
    fds->push_back(fd);
    return fds->size() - 1;
  };
  Value payload = Value::array({Value(static_cast<std::int64_t>(message.kind)), Value(message.id),
                                Value(message.text), Value(ValueArray(message.values))});
  frame->assign(kLumoHeaderSize, 0);
  if (!CborCodec::encode(payload, frame, &hooks, error, limits.maxDepth, splices)) return false;
  std::size_t length = frame->size() - kLumoHeaderSize;
  if (splices != nullptr) {
    for (const CborSplice& splice : *splices) length += splice.bytes->size();
  }
  if (length > limits.maxPayload) {
    if (error != nullptr) *error = "message larger than the size limit";
    return false;
  }
  putU32(frame->data(), kLumoMagic);
  putU32(frame->data() + 4, static_cast<std::uint32_t>(length));
  putU32(frame->data() + 8, static_cast<std::uint32_t>(fds->size()));
  return true;
}

void LumoFrameSplitter::addBytes(std::span<const std::uint8_t> bytes) {
  if (consumed_ > 0 && consumed_ == buffer_.size()) {
    buffer_.clear();
    consumed_ = 0;
  }
  const std::size_t frameStart = consumed_;
  buffer_.insert(buffer_.end(), bytes.begin(), bytes.end());
  // The frame in front, once its length is known, gets its whole buffer at once.
  if (buffer_.size() - frameStart >= kLumoHeaderSize &&
      getU32(buffer_.data() + frameStart) == kLumoMagic) {
    const std::uint32_t length = getU32(buffer_.data() + frameStart + 4);
    if (length <= limits_.maxPayload && length <= limits_.wholeFrameBuffer) {
      buffer_.reserve(frameStart + kLumoHeaderSize + length);
    }
  }
}

LumoFrameSplitter::Status LumoFrameSplitter::next(LumoRawFrame* frame, std::string* error) {
  auto malformed = [error](std::string why) {
    *error = std::move(why);
    return Status::Malformed;
  };
  const std::size_t available = buffer_.size() - consumed_;
  if (available < kLumoHeaderSize) return Status::NeedMore;
  const std::uint8_t* header = buffer_.data() + consumed_;
  if (getU32(header) != kLumoMagic) return malformed("bad frame magic");
  const std::uint32_t length = getU32(header + 4);
  const std::uint32_t descriptorCount = getU32(header + 8);
  if (length > limits_.maxPayload) return malformed("frame larger than the size limit");
  if (descriptorCount > limits_.maxDescriptors) return malformed("too many descriptors");
  if (available < kLumoHeaderSize + length) return Status::NeedMore;
  if (descriptors_.size() < descriptorCount) return malformed("descriptors missing for a frame");

  // [kind, id, ...]: a definite array of four, then two unsigned integers.
  std::span<const std::uint8_t> payload(header + kLumoHeaderSize, length);
  std::size_t at = 1;
  std::optional<std::uint64_t> kind;
  std::optional<std::uint64_t> id;
  if (!payload.empty() && payload[0] == 0x84) {
    kind = peekUnsigned(payload, &at);
    if (kind) id = peekUnsigned(payload, &at);
  }
  if (!kind || *kind > 3 || !id) return malformed("a message that is not [kind, id, text, values]");

  frame->kind = static_cast<LumoMessage::Kind>(*kind);
  frame->id = *id;
  frame->descriptors.clear();
  for (std::uint32_t i = 0; i < descriptorCount; ++i) {
    frame->descriptors.push_back(std::move(descriptors_[i]));
  }
  descriptors_.erase(descriptors_.begin(), descriptors_.begin() + descriptorCount);
  if (consumed_ == 0 && kLumoHeaderSize + length == buffer_.size()) {
    // The frame is all that is buffered, as a large message usually is once complete: the buffer
    // becomes the payload, without a second allocation of its size.
    frame->payload = std::move(buffer_);
    frame->payloadStart = kLumoHeaderSize;
    buffer_.clear();
    return Status::Frame;
  }
  frame->payload.assign(payload.begin(), payload.end());
  frame->payloadStart = 0;
  consumed_ += kLumoHeaderSize + length;
  if (consumed_ == buffer_.size()) {
    buffer_.clear();
    consumed_ = 0;
  } else if (consumed_ > (64u << 10) && consumed_ * 2 > buffer_.size()) {
    buffer_.erase(buffer_.begin(), buffer_.begin() + static_cast<std::ptrdiff_t>(consumed_));
    consumed_ = 0;
  }
  return Status::Frame;
}

std::optional<LumoMessage> decodeLumoFrame(
    LumoRawFrame frame, const LumoLimits& limits,
    const std::function<std::shared_ptr<const IpcEndpoint>(UniqueFd)>& toEndpoint,
    std::string* error) {
  std::vector<std::shared_ptr<const IpcEndpoint>> endpoints;
  for (UniqueFd& fd : frame.descriptors) {
    endpoints.push_back(toEndpoint ? toEndpoint(std::move(fd)) : nullptr);
  }
  EndpointHooks hooks;
  hooks.fromIndex = [&endpoints](std::uint64_t index) -> std::shared_ptr<const IpcEndpoint> {
    return index < endpoints.size() ? endpoints[index] : nullptr;
  };
  DecodeLimits decodeLimits;
  decodeLimits.maxBytes = limits.maxPayload;
  decodeLimits.maxDepth = limits.maxDepth;
  decodeLimits.maxItems = limits.maxItems;
  // Large parts of the message stay encoded in the payload until read; endpoints are taken now.
  auto payload = std::make_shared<const Bytes>(std::move(frame.payload));
  std::string why;
  std::optional<Value> decoded = CborCodec::decodeLazily(
      payload, std::span(*payload).subspan(frame.payloadStart), decodeLimits, &hooks, &why);
  if (!decoded) {
    *error = "undecodable message: " + why;
    return std::nullopt;
  }
  const ValueArray* parts = decoded->asArray();
  const bool four = parts != nullptr && parts->size() == 4;
  std::optional<std::int64_t> kind = four ? (*parts)[0].asInt() : std::nullopt;
  std::optional<std::uint64_t> id = four ? (*parts)[1].asUInt() : std::nullopt;
  const std::string* text = four ? (*parts)[2].asString() : nullptr;
  const ValueArray* values = four ? (*parts)[3].asArray() : nullptr;
  if (!kind || *kind < 0 || *kind > 3 || !id || text == nullptr || values == nullptr) {
    *error = "a message that is not [kind, id, text, values]";
    return std::nullopt;
  }
  LumoMessage message;
  message.kind = static_cast<LumoMessage::Kind>(*kind);
  message.id = *id;
  message.text = *text;
  message.values = *values;
  return message;
}

}  // namespace typhora
