// Admission of client connections and the dispatch of operations the handler hands on.
#include <memory>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "ipc/typhora_handler.h"

namespace typhora {
namespace {

// The strings of an array argument (the interface has checked that it is an array); elements of
// other types are not paths and are left out.
std::vector<std::string> stringsOf(const Value& array) {
  std::vector<std::string> strings;
  for (const Value& item : *array.asArray())
    if (const std::string* text = item.asString()) strings.push_back(*text);
  return strings;
}

}  // namespace

bool TyphoraDaemon::shouldAcceptNewConnection(IpcListener& /*listener*/,
                                              std::shared_ptr<IpcConnection> connection) {
  // Every connection is accepted: what a client may do is decided per operation.
  connection->setExportedInterface(typhoraDaemonProtocol());
  auto handler = std::make_shared<TyphoraHandler>(shared_from_this());
  connection->setExportedObject(handler);
  connection->setRemoteInterface(typhoraClientProtocol());
  // The closure owns the handler; clearing clientConnection breaks the connection-handler cycle.
  connection->setInvalidationHandler([handler] { handler->setClientConnection(nullptr); });
  handler->setClientConnection(connection);
  {
    std::lock_guard lock(handlersMutex_);
    std::erase_if(handlers_, [](const auto& weak) {
      auto tracked = weak.lock();
      return !tracked || !tracked->clientConnection();
    });
    handlers_.push_back(handler);
  }
  connection->resume();
  return true;
}

std::vector<std::shared_ptr<TyphoraHandler>> TyphoraDaemon::liveHandlers() {
  std::vector<std::shared_ptr<TyphoraHandler>> live;
  std::lock_guard lock(handlersMutex_);
  for (const auto& weak : handlers_) {
    auto handler = weak.lock();
    if (handler && handler->clientConnection()) live.push_back(std::move(handler));
  }
  return live;
}

bool TyphoraDaemon::forwardInvocation(const IpcOperation& operation,
                                      const std::vector<Value>& arguments, const IpcReply& reply) {
  const std::string& name = operation.wireName;
  if (name == op::kUpdatingUserFonts) {
    updatingUserFonts([&reply] { reply({}); });
    return true;
  }
  if (name == op::kFontChanged) {
    fontChanged(arguments.at(0), reply);
    return true;
  }
  if (name == op::kScheduleFontFilesDeletion) {
    scheduleFontFilesDeletion(stringsOf(arguments.at(0)));
    return true;
  }
  if (name == op::kSynchronizeFontAssets) {
    synchronizeFontAssets(stringsOf(arguments.at(0)), reply);
    return true;
  }
  if (name == op::kRequestFonts) {
    requestFonts(*arguments.at(0).asArray(), reply);
    return true;
  }
  if (name == op::kRequestFontsForClient) {
    requestFonts(*arguments.at(0).asString(), *arguments.at(1).asEndpoint(), reply);
    return true;
  }
  if (name == op::kResetIssuedFontsFor) {
    resetIssuedFontsFor(*arguments.at(0).asString(), reply);
    return true;
  }
  return false;
}

}  // namespace typhora
