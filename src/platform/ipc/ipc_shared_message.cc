#include "platform/ipc/ipc_shared_message.h"

namespace typhora {

IpcSharedMessage::IpcSharedMessage(std::string wireName, std::vector<Value> arguments)
    : wireName_(std::move(wireName)), arguments_(std::move(arguments)) {}

IpcSharedMessage::Encoding IpcSharedMessage::encodingFor(
    const std::shared_ptr<const IpcInterface>& remote,
    const std::function<Encoding()>& encode) const {
  std::lock_guard lock(mutex_);
  for (const Made& made : made_) {
    if (made.remote == remote) return made.bytes;
  }
  Encoding bytes = encode();
  made_.push_back({remote, bytes});
  return bytes;
}

}  // namespace typhora
