#include "service_session.h"

#include <chrono>
#include <iostream>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "platform/linux/lumo/lumo_connection.h"

namespace typhora::ctl {

ServiceSession::ServiceSession(const ClientOptions& options,
                               std::shared_ptr<const IpcInterface> remote,
                               std::shared_ptr<IpcExportedObject> exported)
    : options_(options), remote_(std::move(remote)), service_(options.runtimeDir) {
  connection_ = service_.connectToService(kServiceName);
  if (exported) {
    connection_->setExportedInterface(typhoraClientProtocol());
    connection_->setExportedObject(std::move(exported));
  }
  connection_->setRemoteInterface(remote_);
  connection_->resume();
}

ServiceSession::~ServiceSession() {
  connection_->invalidate();
}

CallResult ServiceSession::call(const std::string& wireName, std::vector<Value> arguments) {
  CallResult result;
  const IpcOperation* operation = remote_->find(wireName);
  auto proxy = connection_->synchronousRemoteObjectProxy(
      [&result](const std::string& error) { result.error = error; });
  proxy->call(wireName, std::move(arguments), [&result](std::vector<Value> reply) {
    result.ok = true;
    result.reply = std::move(reply);
  });
  // A one-way operation has no reply: it succeeded once it has left.
  if (operation != nullptr && !operation->replies && result.error.empty()) {
    auto lumo = std::dynamic_pointer_cast<LumoConnection>(connection_);
    result.ok =
        lumo == nullptr || lumo->waitUntilSent(std::chrono::seconds(options_.timeoutSeconds));
    if (!result.ok) result.error = "the message could not be sent";
  }
  return result;
}

int printCall(const CallResult& result) {
  if (!result.ok) {
    std::cerr << "typhoractl: " << (result.error.empty() ? "no reply" : result.error) << "\n";
    return 1;
  }
  std::cout << JsonCodec::encode(Value(ValueArray(result.reply))) << "\n";
  return 0;
}

}  // namespace typhora::ctl
