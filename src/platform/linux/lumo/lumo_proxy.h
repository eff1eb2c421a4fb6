// A remote proxy of a lumo connection: calls of the remote interface, asynchronous or waiting
// for their answer. It holds its connection weakly, so a proxy kept by a client does not keep a
// connection alive.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/ipc/ipc_connection.h"

namespace typhora {

class LumoConnection;

class LumoProxy final : public IpcRemoteProxy {
 public:
  LumoProxy(std::weak_ptr<LumoConnection> connection, IpcErrorHandler onError, bool synchronous);
  void call(const std::string& wireName, std::vector<Value> arguments, IpcReply onReply) override;

 private:
  std::weak_ptr<LumoConnection> connection_;
  IpcErrorHandler onError_;
  bool synchronous_;
};

}  // namespace typhora
