// One peer of the event socket: serves its posts, activity runs and watch request. The session
// and its connection hold each other until the connection is invalidated.
#pragma once

#include <memory>
#include <mutex>

#include "platform/ipc/ipc_connection.h"

namespace typhora {

class LinuxEventHub;

class EventSocketSession final : public IpcExportedObject {
 public:
  explicit EventSocketSession(std::weak_ptr<LinuxEventHub> hub) : hub_(std::move(hub)) {}
  void setConnection(std::shared_ptr<IpcConnection> connection);
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;

 private:
  std::weak_ptr<LinuxEventHub> hub_;
  std::mutex mutex_;
  std::shared_ptr<IpcConnection> connection_;
};

}  // namespace typhora
