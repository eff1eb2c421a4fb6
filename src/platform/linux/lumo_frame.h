// lumo's wire format. A frame is a 12-byte header (magic, payload length, descriptor count, all
// little-endian 32-bit) and a CBOR payload; the descriptors travel beside the frame's first byte
// (SCM_RIGHTS). The payload is one message: [kind, id, name or error, values].
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/linux/unique_fd.h"
#include "platform/value.h"
#include "platform/value_codec.h"

namespace typhora {

struct LumoMessage {
  enum class Kind : std::uint8_t { Invoke = 0, Reply = 1, Error = 2 };
  Kind kind = Kind::Invoke;
  std::uint64_t id = 0;       // the reply id; 0 for a one-way invocation
  std::string text;           // the wire name (Invoke) or the error (Error)
  std::vector<Value> values;  // arguments or reply values
};

struct LumoLimits {
  std::uint32_t maxPayload = 64u << 20;
  std::uint32_t maxDescriptors = 16;
  std::size_t maxDepth = 64;
};

inline constexpr std::uint32_t kLumoMagic = 0x4F4D554C;  // "LUMO"
inline constexpr std::size_t kLumoHeaderSize = 12;

// Reassembles frames from a byte stream and the descriptors received beside it.
class LumoFrameDecoder {
 public:
  explicit LumoFrameDecoder(LumoLimits limits = {}) : limits_(limits) {}

  void addBytes(std::span<const std::uint8_t> bytes) {
    buffer_.insert(buffer_.end(), bytes.begin(), bytes.end());
  }
  void addDescriptor(UniqueFd fd) { descriptors_.push_back(std::move(fd)); }

  enum class Status { Message, NeedMore, Malformed };
  // The next complete message, with its descriptors turned into endpoints by `toEndpoint`.
  Status next(LumoMessage* message, std::string* error,
              const std::function<std::shared_ptr<const IpcEndpoint>(UniqueFd)>& toEndpoint);

 private:
  LumoLimits limits_;
  std::vector<std::uint8_t> buffer_;
  std::size_t consumed_ = 0;
  std::vector<UniqueFd> descriptors_;
};

// Encodes a message into a frame; endpoints become descriptor indexes appended to `fds`
// (duplicated by `fdOf`). False with `error` when the message cannot be encoded.
bool encodeLumoFrame(const LumoMessage& message, std::vector<std::uint8_t>* frame,
                     std::vector<int>* fds,
                     const std::function<int(const std::shared_ptr<const IpcEndpoint>&)>& fdOf,
                     std::string* error, const LumoLimits& limits = {});

}  // namespace typhora
