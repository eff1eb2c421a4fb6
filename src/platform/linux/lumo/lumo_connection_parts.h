// What the parts of a lumo connection share: its pending calls, its queued outgoing frames, and
// the helpers that both the reading and the lifecycle side use.
#pragma once

#include <sys/uio.h>

#include <algorithm>
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
  // Kept encodings sent in place between pieces of `bytes`: an answer carrying the user-fonts
  // records is not copied into a buffer of its own (megabytes, page by page) for each client.
  std::vector<CborSplice> splices;
  std::vector<UniqueFd> fds;  // sent beside the first byte, then closed
  std::size_t offset = 0;     // bytes of the whole frame already sent

  const std::vector<std::uint8_t>& frame() const { return shared ? *shared : bytes; }

  std::size_t size() const {
    std::size_t size = frame().size();
    for (const CborSplice& splice : splices) size += splice.bytes->size();
    return size;
  }

  // The pieces of the frame still to send, from `offset` on: at most `max`, and how many.
  std::size_t unsent(iovec* iov, std::size_t max) const {
    const std::vector<std::uint8_t>& head = frame();
    std::size_t count = 0;
    std::size_t at = 0;  // where the next piece starts in the whole frame
    auto add = [&](const std::uint8_t* data, std::size_t length) {
      const std::size_t skip = offset > at ? std::min(offset - at, length) : 0;
      if (length > skip && count < max) {
        iov[count++] = {const_cast<std::uint8_t*>(data) + skip, length - skip};
      }
      at += length;
    };
    std::size_t from = 0;  // the next byte of `head` to send
    for (const CborSplice& splice : splices) {
      add(head.data() + from, splice.at - from);
      add(splice.bytes->data(), splice.bytes->size());
      from = splice.at;
    }
    add(head.data() + from, head.size() - from);
    return count;
  }
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
