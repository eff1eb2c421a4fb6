#include "platform/linux/lumo/lumo_proxy.h"

#include "platform/linux/lumo/lumo_connection.h"

namespace typhora {

LumoProxy::LumoProxy(std::weak_ptr<LumoConnection> connection, IpcErrorHandler onError,
                     bool synchronous)
    : connection_(std::move(connection)), onError_(std::move(onError)), synchronous_(synchronous) {}

void LumoProxy::call(const std::string& wireName, std::vector<Value> arguments, IpcReply onReply) {
  auto connection = connection_.lock();
  if (!connection) {
    if (onError_) onError_("the connection is gone");
    return;
  }
  connection->call(wireName, std::move(arguments), std::move(onReply), onError_, synchronous_);
}

}  // namespace typhora
