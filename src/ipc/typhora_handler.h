// One handler per admitted client connection: it serves the check-in operations itself and hands
// every other operation to the daemon.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/ipc/ipc_connection.h"
#include "platform/ipc/ipc_endpoint.h"
#include "platform/log/log.h"

namespace typhora {

class TyphoraDaemon;

class TyphoraHandler final : public IpcExportedObject,
                             public std::enable_shared_from_this<TyphoraHandler> {
 public:
  explicit TyphoraHandler(std::shared_ptr<TyphoraDaemon> server);
  ~TyphoraHandler() override;

  // Runs on the connection's queue with the connection current.
  bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
              IpcReply reply) override;

  // The two check-ins, on the connection's queue: capabilities from the caller's signature, then
  // the fonts and tokens it may have.
  void checkin(const IpcReply& reply);
  void checkinForFontPicker(const IpcReply& reply);

  // Web-content support (ipc/web_content_support.cc), on the application's connection queue:
  // connects to the web-content process at `endpoint`, hands it the fonts and tokens the
  // application's capabilities allow, issued for the web-content process, and replies once the
  // web-content process has acknowledged them.
  void checkinForBrisvelProcess(std::shared_ptr<const IpcEndpoint> endpoint, const IpcReply& reply);
  void addWebContentProcessConnection(std::shared_ptr<IpcConnection> connection);
  // Removes `connection` from webcontentProcessConnections, if there.
  void removeWebContentProcessConnection(const IpcConnection* connection);

  // Font changes, on mainHandlerQueue, for handlers registered by checkin
  // (ipc/font_change_fanout.cc): the client is sent what it may see of the change.
  void fontChanged(const Value& change);

  // True exactly for the font-registry library's own process identifier (case-sensitive).
  static bool isProcessIdentifierToIgnore(const std::string* identifier);

  bool hasEnumerationEntitlement() const;
  bool hasFontAccessEntitlement() const;
  bool isFontProvider() const;
  std::optional<std::string> processIdentifier() const;

  // The connection this handler serves; null once it has been invalidated.
  std::shared_ptr<IpcConnection> clientConnection() const;
  void setClientConnection(std::shared_ptr<IpcConnection> connection);
  const std::shared_ptr<TyphoraDaemon>& server() const { return server_; }

  std::vector<std::shared_ptr<IpcConnection>> webcontentProcessConnections() const;

  // The connection as the daemon's status shows it (ipc/handler_status.cc): peer, signing
  // identifier, capabilities, whether it checked in, its web-content connections.
  Value statusRecord() const;
  // The peer its log lines are about: pid, and signing identifier once checked in.
  LogPeer logPeer() const;

 private:
  void observeFontChanges();

  // The fields are written on the connection's thread and read from mainHandlerQueue and from
  // invalidation handlers on other threads, so one mutex guards them all.
  mutable std::mutex mutex_;
  bool hasEnumerationEntitlement_ = false;
  bool hasFontAccessEntitlement_ = false;
  bool isFontProvider_ = false;
  std::shared_ptr<IpcConnection> clientConnection_;
  const std::shared_ptr<TyphoraDaemon> server_;
  std::optional<std::string> processIdentifier_;
  // Set by checkin: whether it ran, and the signing identifier it found.
  bool checkedIn_ = false;
  std::optional<std::string> signingIdentifier_;
  std::optional<std::vector<std::shared_ptr<IpcConnection>>> webcontentProcessConnections_;
};

}  // namespace typhora
