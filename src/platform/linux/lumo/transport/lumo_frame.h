// lumo's wire format. A frame is a 12-byte header (magic, payload length, descriptor count, all
// little-endian 32-bit) and a CBOR payload; the descriptors travel beside the frame's first byte
// (SCM_RIGHTS). The payload is one message: [kind, id, name or error, values].
//
// Reading is split in two: the I/O thread only cuts the stream into raw frames and peeks at each
// frame's kind and id (a few bytes), so a hostile frame costs it nothing; the CBOR decoding runs
// later, on the thread that handles the message.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/fd/unique_fd.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/value.h"
#include "platform/value/value_codec.h"

namespace typhora {

struct LumoMessage {
  // Hello opens a connection: the accepting side sends one with a fresh nonce once it has read
  // its peer's identity; the connecting side's first frame is a Hello that carries it back.
  enum class Kind : std::uint8_t { Invoke = 0, Reply = 1, Error = 2, Hello = 3 };
  Kind kind = Kind::Invoke;
  std::uint64_t id = 0;       // the reply id; 0 for a one-way invocation
  std::string text;           // the wire name (Invoke), the error (Error), the version (Hello)
  std::vector<Value> values;  // arguments or reply values
};

struct LumoLimits {
  std::uint32_t maxPayload = 64u << 20;
  std::uint32_t maxDescriptors = 16;  // per frame
  std::size_t maxDepth = 64;
  std::size_t maxItems = 4u << 20;  // array elements and dictionary entries of one message
  // A frame up to this size gets its whole buffer once its header is in, not one grown and
  // copied chunk by chunk: a service's answers are taken at their word, a client's calls not.
  std::uint32_t wholeFrameBuffer = 64u << 20;

  // What a service accepts from its clients: they send small calls (large answers go out, not
  // in), so a hostile frame costs little memory and decoding time.
  static LumoLimits inboundFromClients() { return {1u << 20, 16, 32, 1u << 16, 64u << 10}; }
};

inline constexpr std::uint32_t kLumoMagic = 0x4F4D554C;  // "LUMO"
inline constexpr std::size_t kLumoHeaderSize = 12;

// A frame cut from the stream, not yet decoded.
struct LumoRawFrame {
  LumoMessage::Kind kind = LumoMessage::Kind::Invoke;
  std::uint64_t id = 0;
  // The payload from `payloadStart` on: a large frame keeps its header in front, where it was
  // read, rather than move megabytes down by twelve bytes.
  std::vector<std::uint8_t> payload;
  std::size_t payloadStart = 0;
  std::vector<UniqueFd> descriptors;
};

// Cuts frames from a byte stream and the descriptors received beside it.
class LumoFrameSplitter {
 public:
  explicit LumoFrameSplitter(LumoLimits limits = {}) : limits_(limits) {}

  void addBytes(std::span<const std::uint8_t> bytes);
  void addDescriptor(UniqueFd fd) { descriptors_.push_back(std::move(fd)); }
  // Bytes of frames not yet complete, and descriptors not yet handed out with a frame.
  std::size_t bufferedBytes() const { return buffer_.size() - consumed_; }
  std::size_t heldDescriptors() const { return descriptors_.size(); }

  enum class Status { Frame, NeedMore, Malformed };
  Status next(LumoRawFrame* frame, std::string* error);

 private:
  LumoLimits limits_;
  std::vector<std::uint8_t> buffer_;
  std::size_t consumed_ = 0;
  std::vector<UniqueFd> descriptors_;
};

// Decodes a raw frame, turning its descriptors into endpoints with `toEndpoint`.
std::optional<LumoMessage> decodeLumoFrame(
    LumoRawFrame frame, const LumoLimits& limits,
    const std::function<std::shared_ptr<const IpcEndpoint>(UniqueFd)>& toEndpoint,
    std::string* error);

// Encodes a message into a frame; endpoints become descriptor indexes appended to `fds`
// (duplicated by `fdOf`). False with `error` when the message cannot be encoded. With
// `splices`, large kept encodings stay out of `frame` and are listed there, to be sent in place
// (the header's length counts them).
bool encodeLumoFrame(const LumoMessage& message, std::vector<std::uint8_t>* frame,
                     std::vector<int>* fds,
                     const std::function<int(const std::shared_ptr<const IpcEndpoint>&)>& fdOf,
                     std::string* error, const LumoLimits& limits = {},
                     std::vector<CborSplice>* splices = nullptr);

}  // namespace typhora
