#include "ipc/typhora_handler.h"

#include <string_view>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/log.h"

namespace typhora {
namespace {

constexpr std::string_view kFontManagerProcessIdentifier = "com.zorvane.Typhora.UserFontManager";
constexpr const char* kHandlerDeallocated = "TyphoraHandler deallocated.";

}  // namespace

TyphoraHandler::TyphoraHandler(std::shared_ptr<TyphoraDaemon> server)
    : server_(std::move(server)) {}

TyphoraHandler::~TyphoraHandler() {
  TYLog_Debug(kTYLogTyphoraDaemon, kHandlerDeallocated);
}

bool TyphoraHandler::invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
                            IpcReply reply) {
  const std::string& name = operation.wireName;
  if (name == op::kSendFonts) {
    // Accepted and deliberately never answered.
    return true;
  }
  if (name == op::kCheckin || name == op::kCheckinForFontPicker ||
      name == op::kCheckinForBrisvelProcess) {
    return false;  // check-in is not served yet: refused as unrecognised
  }
  return server_->forwardInvocation(operation, arguments, reply);
}

bool TyphoraHandler::isProcessIdentifierToIgnore(const std::string* identifier) {
  return identifier != nullptr && *identifier == kFontManagerProcessIdentifier;
}

bool TyphoraHandler::hasEnumerationEntitlement() const {
  std::lock_guard lock(mutex_);
  return hasEnumerationEntitlement_;
}

bool TyphoraHandler::hasFontAccessEntitlement() const {
  std::lock_guard lock(mutex_);
  return hasFontAccessEntitlement_;
}

bool TyphoraHandler::isFontProvider() const {
  std::lock_guard lock(mutex_);
  return isFontProvider_;
}

std::optional<std::string> TyphoraHandler::processIdentifier() const {
  std::lock_guard lock(mutex_);
  return processIdentifier_;
}

std::shared_ptr<IpcConnection> TyphoraHandler::clientConnection() const {
  std::lock_guard lock(mutex_);
  return clientConnection_;
}

void TyphoraHandler::setClientConnection(std::shared_ptr<IpcConnection> connection) {
  std::shared_ptr<IpcConnection> previous;
  {
    std::lock_guard lock(mutex_);
    previous = std::exchange(clientConnection_, std::move(connection));
  }
  // `previous` may be the last reference to the connection: let it go outside the lock.
}

std::vector<std::shared_ptr<IpcConnection>> TyphoraHandler::webcontentProcessConnections() const {
  std::lock_guard lock(mutex_);
  return webcontentProcessConnections_.value_or(std::vector<std::shared_ptr<IpcConnection>>{});
}

}  // namespace typhora
