#include "ipc/typhora_handler.h"

#include <string_view>

#include "catalog/font_record.h"
#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/log/log.h"

namespace typhora {
namespace {

constexpr std::string_view kFontManagerProcessIdentifier = "com.zorvane.Typhora.UserFontManager";
constexpr const char* kHandlerDeallocated = "TyphoraHandler deallocated.";

}  // namespace

TyphoraHandler::TyphoraHandler(std::shared_ptr<TyphoraDaemon> server)
    : server_(std::move(server)) {}

TyphoraHandler::~TyphoraHandler() {
  server_->localNotificationCenter().removeObserver(this);
  TYLog_Debug(kTYLogTyphoraDaemon, kHandlerDeallocated);
}

bool TyphoraHandler::invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
                            IpcReply reply) {
  const LogPeerScope peer(logPeer());
  const std::string& name = operation.wireName;
  if (name == op::kSendFonts) {
    // Accepted and deliberately never answered.
    return true;
  }
  if (name == op::kCheckin) {
    checkin(reply);
    return true;
  }
  if (name == op::kCheckinForFontPicker) {
    checkinForFontPicker(reply);
    return true;
  }
  if (name == op::kCheckinForBrisvelProcess) {
    checkinForBrisvelProcess(*arguments.at(0).asEndpoint(), reply);
    return true;
  }
  return server_->forwardInvocation(operation, arguments, reply);
}

void TyphoraHandler::checkin(const IpcReply& reply) {
  const AuditToken token = currentAuditToken();
  bool enumeration = false;
  bool fontAccess = false;
  bool provider = false;
  std::optional<std::string> identifier;
  server_->capabilitiesFor(token, &enumeration, &fontAccess, &provider, &identifier);
  {
    std::lock_guard lock(mutex_);
    hasEnumerationEntitlement_ = enumeration;
    hasFontAccessEntitlement_ = fontAccess;
    isFontProvider_ = provider;
    checkedIn_ = true;
    signingIdentifier_ = identifier;
  }
  if (isProcessIdentifierToIgnore(identifier ? &*identifier : nullptr)) {
    reply({Value()});
    return;
  }
  observeFontChanges();
  server_->setupUserInstalledFontsFor(token, token, enumeration, fontAccess, provider, identifier,
                                      reply);
  if (provider) {
    std::lock_guard lock(mutex_);
    processIdentifier_ = identifier;
  }
}

void TyphoraHandler::checkinForFontPicker(const IpcReply& reply) {
  if (!server_->isCurrentConnectionFontPicker()) {
    reply({Value()});
    return;
  }
  const AuditToken token = currentAuditToken();
  server_->mainHandlerQueue().sync([&] {
    {
      std::lock_guard lock(mutex_);
      hasEnumerationEntitlement_ = true;
    }
    Value fonts = server_->filterUserFontInfoForAuditToken(
        token, true, [](const std::string&, const Value& record, bool*) {
          return !FontRecord::isDisabled(record);
        });
    std::vector<DictionaryEntry> checkin{{"fontsInfo", std::move(fonts)}};
    if (Value extension = server_->sandboxExtensionForEnumeration(token); !extension.isNull())
      checkin.emplace_back("extension", extension);
    if (Value extension = server_->sandboxExtensionForFontAssets(token); !extension.isNull())
      checkin.emplace_back("extension.fontasset", extension);
    reply({Value(Dictionary(std::move(checkin)))});
  });
}

LogPeer TyphoraHandler::logPeer() const {
  std::lock_guard lock(mutex_);
  const AuditToken peer = clientConnection_ ? clientConnection_->auditToken() : AuditToken{};
  return {peer.pid, signingIdentifier_.value_or("")};
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
