// The event socket's protocol: a frame from a peer, decoded, looked up and checked against the
// operation as the connection does before the session runs it. The session dereferences the
// string arguments an operation declares, so a call that passes the check must carry them.
#include <cstdint>

#include "platform/ipc/ipc_interface.h"
#include "platform/linux/events/event_socket_protocol.h"
#include "platform/linux/lumo/transport/lumo_frame.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const auto protocol = typhora::eventSocketProtocol();
  const typhora::LumoLimits limits = typhora::LumoLimits::inboundFromClients();
  typhora::LumoFrameSplitter splitter(limits);
  splitter.addBytes({data, size});
  typhora::LumoRawFrame frame;
  std::string error;
  while (splitter.next(&frame, &error) == typhora::LumoFrameSplitter::Status::Frame) {
    auto message = typhora::decodeLumoFrame(std::move(frame), limits, nullptr, &error);
    frame = {};
    if (!message || message->kind != typhora::LumoMessage::Kind::Invoke) continue;
    const typhora::IpcOperation* op = protocol->find(message->text);
    if (op == nullptr || !typhora::IpcInterface::matches(*op, message->values, &error)) continue;
    for (std::size_t i = 0; i < op->arguments.size(); ++i) {
      const bool isString = op->arguments[i].kind == typhora::IpcType::Kind::String;
      if (isString && !op->arguments[i].nullable &&
          (i >= message->values.size() || message->values[i].asString() == nullptr)) {
        __builtin_trap();
      }
    }
  }
  return 0;
}
