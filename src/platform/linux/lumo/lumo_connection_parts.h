// What the parts of a lumo connection share: its pending calls, its queued outgoing frames, and
// the helpers that both the reading and the lifecycle side use.
#pragma once

#include <array>
#include <condition_variable>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/fd/unique_fd.h"
#include "platform/linux/lumo/lumo_connection.h"

namespace typhora {

struct LumoConnection::Pending {
  IpcReply onReply;
  IpcErrorHandler onError;
  bool synchronous = false;
  // Synchronous calls: the raw answer lands here and wakes the caller, who decodes it.
  std::mutex mutex;
  std::condition_variable answered;
  bool done = false;
  std::optional<LumoRawFrame> frame;
  std::string error;
};

struct LumoConnection::Outgoing {
  std::vector<std::uint8_t> bytes;
  IpcSharedMessage::Encoding shared;  // instead of `bytes`: a frame other connections send too
  std::vector<UniqueFd> fds;          // sent beside the first byte, then closed
  std::size_t offset = 0;

  const std::vector<std::uint8_t>& frame() const { return shared ? *shared : bytes; }
};

namespace lumo_detail {

// Why a connection ended when its peer closed its end or went away.
inline constexpr const char* kPeerClosed = "the peer closed the connection";

// Completes a pending call with its raw answer (or an error) and wakes a synchronous caller.
inline void finish(const std::shared_ptr<LumoConnection::Pending>& p,
                   std::optional<LumoRawFrame> frame, std::string error) {
  std::lock_guard lock(p->mutex);
  p->frame = std::move(frame);
  p->error = std::move(error);
  p->done = true;
  p->answered.notify_all();
}

inline LumoMessage helloWith(const std::array<std::uint8_t, 16>& nonce) {
  return LumoMessage{LumoMessage::Kind::Hello,
                     0,
                     LumoConnection::kVersion,
                     {Value::data(std::vector<std::uint8_t>(nonce.begin(), nonce.end()))}};
}

}  // namespace lumo_detail
}  // namespace typhora
