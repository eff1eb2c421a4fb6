// Fonts for the web-content processes of an application: each is reached on the endpoint its
// application hands over, and receives what the application may see, with tokens of its own.
#include <algorithm>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "ipc/typhora_handler.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kInvalidated =
    "TYBrisvel checkinForBrisvelProcess connection invalidationHandler.";
constexpr const char* kInterrupted =
    "TYBrisvel checkinForBrisvelProcess connection interruptionHandler.";
constexpr const char* kCallingPing = "TYBrisvel calling ping2";
constexpr const char* kLumoError = "lumo error: %s - %@";
constexpr const char* kErrorSite =
    "-[TyphoraHandler checkinForBrisvelProcess:reply:]_block_invoke_2";

// The application's capabilities as they were when its web-content check-in began.
struct CapturedCapabilities {
  AuditToken application;
  bool hasEnumeration = false;
  bool hasFontAccess = false;
  bool isFontProvider = false;
  std::optional<std::string> processIdentifier;
};

}  // namespace

void TyphoraHandler::checkinForBrisvelProcess(std::shared_ptr<const IpcEndpoint> endpoint,
                                              const IpcReply& reply) {
  CapturedCapabilities captured;
  captured.application = currentAuditToken();
  std::shared_ptr<IpcConnection> connection = server_->platform().ipc.connect(std::move(endpoint));
  std::weak_ptr<IpcConnection> weakConnection = connection;
  connection->setInvalidationHandler([self = shared_from_this(), weakConnection] {
    SystemLog(kInvalidated);
    if (auto ended = weakConnection.lock()) self->removeWebContentProcessConnection(ended.get());
  });
  connection->setInterruptionHandler([] { SystemLog(kInterrupted); });
  // Listed once its end can unlist it; an end that came first found nothing to remove.
  addWebContentProcessConnection(connection);
  if (!connection->isValid()) removeWebContentProcessConnection(connection.get());
  connection->setRemoteInterface(typhoraBrisvelSupportServerProtocol());
  connection->resume();
  std::shared_ptr<IpcRemoteProxy> webContent = connection->remoteObjectProxy(
      [](const std::string& error) { SystemLog(kLumoError, kErrorSite, error); });
  SystemLog(kCallingPing);
  {
    std::lock_guard lock(mutex_);
    captured.hasEnumeration = hasEnumerationEntitlement_;
    captured.hasFontAccess = hasFontAccessEntitlement_;
    captured.isFontProvider = isFontProvider_;
    captured.processIdentifier = processIdentifier_;
  }
  std::shared_ptr<TyphoraDaemon> server = server_;
  webContent->call(op::kBrisvelPing, {}, [server, captured, webContent, reply](std::vector<Value>) {
    // The answer arrives on the web-content connection: its peer is the process to serve.
    const AuditToken webContentProcess = currentAuditToken();
    server->setupUserInstalledFontsFor(
        webContentProcess, captured.application, captured.hasEnumeration, captured.hasFontAccess,
        captured.isFontProvider, captured.processIdentifier,
        [webContent, reply](std::vector<Value> checkin) {
          Value fonts = checkin.empty() ? Value() : std::move(checkin[0]);
          webContent->call(op::kUserInstalledFontsInfo, {std::move(fonts)},
                           [reply](std::vector<Value>) { reply({}); });
        });
  });
}

void TyphoraHandler::addWebContentProcessConnection(std::shared_ptr<IpcConnection> connection) {
  std::lock_guard lock(mutex_);
  if (!webcontentProcessConnections_) webcontentProcessConnections_.emplace();
  webcontentProcessConnections_->push_back(std::move(connection));
}

void TyphoraHandler::removeWebContentProcessConnection(const IpcConnection* connection) {
  std::shared_ptr<IpcConnection> removed;  // released outside the lock
  std::lock_guard lock(mutex_);
  if (!webcontentProcessConnections_) return;
  auto& connections = *webcontentProcessConnections_;
  auto found = std::find_if(connections.begin(), connections.end(),
                            [connection](const auto& c) { return c.get() == connection; });
  if (found == connections.end()) return;
  removed = std::move(*found);
  connections.erase(found);
}

}  // namespace typhora
