// Sending one one-way message to many connections: the frame is encoded once and every
// connection's outgoing queue holds the same bytes, bounded and cut off as any other frame.
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_connection_parts.h"

namespace typhora {

void LumoConnection::sendShared(const std::shared_ptr<const IpcSharedMessage>& message,
                                IpcErrorHandler errorHandler) {
  std::shared_ptr<const IpcInterface> remote;
  {
    std::lock_guard lock(mutex_);
    remote = remoteInterface_;
  }
  const IpcOperation* op = remote ? remote->find(message->wireName()) : nullptr;
  IpcSharedMessage::Encoding frame;
  if (op != nullptr && !op->replies) {
    frame = message->encodingFor(remote, [&]() -> IpcSharedMessage::Encoding {
      std::string why;
      if (!IpcInterface::matches(*op, message->arguments(), &why)) return nullptr;
      auto bytes = std::make_shared<std::vector<std::uint8_t>>();
      std::vector<int> fds;
      // No descriptor duplicates: a message carrying endpoints fails here and is sent per
      // connection, each with its own descriptors.
      const LumoMessage invoke{LumoMessage::Kind::Invoke, 0, message->wireName(),
                               message->arguments()};
      if (!encodeLumoFrame(invoke, bytes.get(), &fds, nullptr, &why)) return nullptr;
      return bytes;
    });
  }
  if (!frame) {
    // Refused or not shareable: the ordinary call says why, or sends it alone.
    call(message->wireName(), message->arguments(), {}, std::move(errorHandler), false);
    return;
  }
  auto out = std::make_unique<Outgoing>();
  out->shared = std::move(frame);
  std::string why;
  if (!sendFrame(std::move(out), &why) && errorHandler) errorHandler(why);
}

}  // namespace typhora
