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
  // Answers activations with `activates`, or never when `silent` (a client that hangs).
  FontPickerClient(bool activates, bool silent) : activates_(activates), silent_(silent) {}
  bool shouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;
  int activations() const { return activations_.load(); }

 private:
  const bool activates_;
  const bool silent_;
  std::atomic<int> activations_{0};
};

}  // namespace typhora::ctl
