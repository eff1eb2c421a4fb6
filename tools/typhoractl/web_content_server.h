// What a web-content process offers the daemon on its endpoint: it answers the ping and prints
// the fonts it is given, with the text of every sandbox token in them, as one JSON line.
#pragma once

#include <memory>
#include <mutex>

#include "platform/dispatch/semaphore.h"
#include "platform/ipc/ipc_listener.h"

namespace typhora::ctl {

class WebContentServer final : public IpcListenerDelegate,
                               public IpcExportedObject,
                               public std::enable_shared_from_this<WebContentServer> {
 public:
  bool shouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;
  // Waits until the fonts were received and the acknowledgement has left; false on timeout.
  bool waitForFonts(std::chrono::seconds timeout);

 private:
  std::mutex mutex_;
  std::shared_ptr<IpcConnection> connection_;
  Semaphore received_;
};

}  // namespace typhora::ctl
