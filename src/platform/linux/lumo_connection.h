// A lumo connection over a Unix stream socket.
//
// Incoming messages are read by the process's one I/O thread and handled in order on the
// connection's own serial queue, with the connection current. Outgoing frames are queued with a
// byte bound and written without blocking; a peer that stops reading until the bound is reached
// is cut off. Replies to synchronous calls go straight to the waiting thread, so a synchronous
// call made from the connection's own queue cannot deadlock.
//
// The interruption handler runs when the peer of a connection this process opened (to a named
// service or an endpoint) goes away while calls through it are still unanswered; the
// invalidation handler runs once, always, when the connection ends.
#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/ipc_connection.h"
#include "platform/linux/lumo_frame.h"
#include "platform/linux/unique_fd.h"
#include "platform/serial_queue.h"

namespace typhora {

class LumoConnection final : public IpcConnection {
 public:
  static constexpr std::size_t kOutboundLimit = 32u << 20;

  // A connected socket accepted by a listener.
  static std::shared_ptr<LumoConnection> adopt(UniqueFd fd);
  // A connection to a socket path, made on resume().
  static std::shared_ptr<LumoConnection> toPath(std::string path);
  // A connection to an anonymous listener's endpoint, made on resume().
  static std::shared_ptr<LumoConnection> toEndpoint(std::shared_ptr<const IpcEndpoint> endpoint);
  ~LumoConnection() override;

  void setExportedInterface(std::shared_ptr<const IpcInterface> interface) override;
  void setExportedObject(std::shared_ptr<IpcExportedObject> object) override;
  void setRemoteInterface(std::shared_ptr<const IpcInterface> interface) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void resume() override;
  void invalidate() override;
  bool isValid() const override;
  std::shared_ptr<IpcRemoteProxy> remoteObjectProxy(IpcErrorHandler errorHandler) override;
  std::shared_ptr<IpcRemoteProxy> synchronousRemoteObjectProxy(
      IpcErrorHandler errorHandler) override;
  AuditToken auditToken() const override;

  // Waits until every message sent so far has been written to the socket (a one-way call's
  // sender can then close without losing it). False on timeout, or when the connection ended
  // with some of them unwritten.
  bool waitUntilSent(std::chrono::milliseconds timeout);

  // Sends a call of the remote interface (used by the proxies).
  void call(const std::string& wireName, std::vector<Value> arguments, IpcReply onReply,
            IpcErrorHandler onError, bool synchronous);

  struct Pending;
  struct Outgoing;

 private:
  explicit LumoConnection(bool outgoing);
  bool connectNow(std::string* error);
  void onEvents(std::uint32_t events);
  bool readAvailable(std::string* error);
  bool flushLocked(std::string* error);
  void handleMessage(LumoMessage message);
  void handleInvoke(const LumoMessage& message);
  void refuse(const LumoMessage& message, const std::string& why);
  void deliverReply(LumoMessage message);
  bool send(const LumoMessage& message, std::string* error);
  void end(const std::string& reason, bool peerWentAway);

  const bool outgoing_;
  std::shared_ptr<SerialQueue> queue_;
  mutable std::mutex mutex_;
  UniqueFd fd_;
  std::string path_;
  std::shared_ptr<const IpcEndpoint> endpoint_;
  AuditToken peer_;
  bool resumed_ = false;
  bool valid_ = true;
  bool watchingWrites_ = false;
  std::shared_ptr<const IpcInterface> exportedInterface_;
  std::shared_ptr<IpcExportedObject> exportedObject_;
  std::shared_ptr<const IpcInterface> remoteInterface_;
  std::function<void()> invalidationHandler_;
  std::function<void()> interruptionHandler_;
  std::deque<std::unique_ptr<Outgoing>> outbound_;
  std::size_t outboundBytes_ = 0;
  std::condition_variable sent_;  // outbound_ emptied, or the connection ended
  bool droppedOutbound_ = false;
  bool servingAfterPeerClosed_ = false;  // ended by the peer; queued messages still served
  std::map<std::uint64_t, std::shared_ptr<Pending>> pending_;
  std::uint64_t nextId_ = 1;
  LumoFrameDecoder decoder_;  // touched only by the I/O thread
};

}  // namespace typhora
