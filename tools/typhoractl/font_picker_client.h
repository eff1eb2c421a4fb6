// What a font-picker client offers the daemon on its endpoint: it echoes the ping, prints the
// fonts it is asked to activate as one JSON line, and answers with a set boolean.
#pragma once

#include <atomic>
#include <memory>

#include "platform/ipc/ipc_listener.h"

namespace typhora::ctl {

class FontPickerClient final : public IpcListenerDelegate,
                               public IpcExportedObject,
                               public std::enable_shared_from_this<FontPickerClient> {
 public:
  explicit FontPickerClient(bool activates) : activates_(activates) {}
  bool shouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;
  int activations() const { return activations_.load(); }

 private:
  const bool activates_;
  std::atomic<int> activations_{0};
};

}  // namespace typhora::ctl
