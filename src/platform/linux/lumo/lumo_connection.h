// A lumo connection over a Unix stream socket.
//
// Reading (on the I/O loop's leading thread): a budget of bytes per connection per turn, so one
// busy peer cannot hold the thread; the stream is only cut into raw frames there. Every read
// carries the kernel's credentials of the process that wrote it (SO_PASSCRED), and a frame
// counts only when its writer is the pinned peer process. An invocation is decoded and handled
// on the connection's own serial queue, with the connection current, after a check that the
// peer still runs the program it was pinned with; when that queue is idle, the thread that read
// the frame runs it once it has passed the loop's lead on. A connection whose undispatched
// invocations pile up is not read until its queue catches up: the kernel holds the rest, and the
// peer's writes block. Replies to synchronous calls go to the waiting thread, which decodes them,
// so a synchronous call made from the connection's own queue cannot deadlock and never needs a free
// worker. While one synchronous call waits, its thread reads the socket itself (with the same
// checks) and the I/O thread leaves that socket alone.
//
// Handshake: the accepting side pins its peer's identity, then (once resumed) sends a Hello
// with a fresh nonce; the connecting side's first frame must be a Hello carrying that nonce back,
// so no frame written before the identity was read counts. The connecting side holds its outgoing
// frames until the Hello has come and pins the process that wrote it.
//
// Writing: frames are queued with a byte bound and written without blocking; a peer that stops
// reading until the bound is reached is cut off. Calls of a connection that ended are dropped,
// except one-way messages that arrived before the peer closed.
//
// The interruption handler runs when the peer of a connection this process opened goes away
// while calls through it are still unanswered; the invalidation handler runs once, always, when
// the connection ends.
#pragma once

#include <sys/socket.h>

#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch/serial_queue.h"
#include "platform/fd/unique_fd.h"
#include "platform/ipc/ipc_connection.h"
#include "platform/linux/identity/process_pin.h"
#include "platform/linux/lumo/transport/lumo_frame.h"

namespace typhora {

class LumoConnection final : public IpcConnection {
 public:
  static constexpr std::size_t kOutboundLimit = 32u << 20;
  static constexpr const char* kVersion = "lumo/1";

  // What every connection of this process accepts from its peer (the daemon tightens it).
  static void setInboundLimits(const LumoLimits& limits);
  static LumoLimits inboundLimits();

  // A connected socket accepted by a listener, its peer pinned by the listener.
  static std::shared_ptr<LumoConnection> adopt(UniqueFd fd, ProcessPin peer);
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
  // Queues the message's one frame, encoded by the first connection that sends it.
  void sendShared(const std::shared_ptr<const IpcSharedMessage>& message,
                  IpcErrorHandler errorHandler) override;
  // The pinned peer. On a connection this process opened, the peer is known once its Hello has
  // come: this waits for it (or for the connection's end, or the handshake's time limit).
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
  enum class Handshake { AwaitingHello, AwaitingAck, Done };

  explicit LumoConnection(bool outgoing);
  bool connectNow(std::string* error);
  void greet();
  void armHandshakeLimit();
  // I/O thread.
  void onEvents(std::uint32_t events);
  bool readSome(std::string* error);
  // A synchronous caller's thread reads the socket itself while it waits, so its answer needs
  // no hand-off through the I/O thread; one caller at a time, the I/O thread stands aside.
  bool takeReading();
  void readUntilAnswered(Pending& pending);
  void releaseReading();
  bool checkWriter(const ucred& writer, std::string* error);
  bool takeFrame(LumoRawFrame frame, std::string* error);
  bool takeHello(LumoRawFrame frame, std::string* error);
  void routeReply(LumoRawFrame frame);
  void toQueue(SerialQueue::Job job);
  void updateInboundLocked();
  void updateInterestLocked();
  // The connection's queue.
  void handleInvoke(LumoRawFrame frame);
  void dispatched(std::size_t bytes, std::size_t descriptors);
  void refuse(const LumoMessage& message, const std::string& why);
  void refuseOnce(const std::string& why);
  // A "lumo error" line about this connection's peer, within the budget of the peer's user.
  void peerError(const char* where, const std::string& why) const;
  std::optional<LumoMessage> decode(LumoRawFrame frame, std::string* error);
  // Any thread.
  bool send(const LumoMessage& message, std::string* error);
  bool sendFrame(std::unique_ptr<Outgoing> out, std::string* error);
  bool enqueueLocked(std::unique_ptr<Outgoing> out, bool first, std::string* error);
  bool flushLocked(std::string* error);
  // Cuts the peer off unless some of its piled answers have gone out by then.
  void watchForStall(std::size_t sentBefore);
  bool readHeldLocked() const { return readPaused_ || (answersPiled_ && synchronousWaiting_ == 0); }
  void end(const std::string& reason, bool peerWentAway);

  const bool outgoing_;
  const LumoLimits limits_;
  std::shared_ptr<SerialQueue> queue_;
  mutable std::mutex mutex_;
  mutable std::condition_variable handshakeDone_;
  UniqueFd fd_;
  std::string path_;
  std::shared_ptr<const IpcEndpoint> endpoint_;
  ProcessPin pin_;
  // pin_'s user, for log lines written without the lock (-1 until the peer is known).
  std::atomic<uid_t> peerUid_{static_cast<uid_t>(-1)};
  Handshake handshake_ = Handshake::AwaitingHello;
  std::array<std::uint8_t, 16> nonce_{};
  bool admitted_ = false;  // counted by LumoAdmission (accepted connections)
  bool resumed_ = false;
  bool valid_ = true;
  bool watchingWrites_ = false;
  bool readPaused_ = false;
  bool refusalLogged_ = false;
  std::shared_ptr<const IpcInterface> exportedInterface_;
  std::shared_ptr<IpcExportedObject> exportedObject_;
  std::shared_ptr<const IpcInterface> remoteInterface_;
  std::function<void()> invalidationHandler_;
  std::function<void()> interruptionHandler_;
  std::deque<std::unique_ptr<Outgoing>> outbound_;
  std::size_t outboundBytes_ = 0;
  std::size_t outboundSent_ = 0;  // bytes sent since the start, to tell a stalled peer
  bool answersPiled_ = false;     // not read while too many of its answers wait
  std::condition_variable sent_;  // outbound_ emptied, or the connection ended
  bool droppedOutbound_ = false;
  bool servingAfterPeerClosed_ = false;  // ended by the peer; one-way messages still served
  std::map<std::uint64_t, std::shared_ptr<Pending>> pending_;
  std::size_t synchronousWaiting_ = 0;
  std::uint64_t nextId_ = 1;
  // Invocations handed to the queue and not yet handled.
  std::size_t undispatched_ = 0;
  std::size_t undispatchedBytes_ = 0;
  std::size_t undispatchedDescriptors_ = 0;
  std::size_t splitterBytes_ = 0;     // the splitter's unfinished frame, as the I/O thread last saw
  std::size_t inboundAccounted_ = 0;  // this connection's share of LumoAdmission's inbound bytes
  // The read side (splitter_, the socket's receive queue): the I/O thread, or a synchronous
  // caller that took the reading (callerReads_), holds readMutex_ while it reads. Taken before
  // mutex_, never after it.
  std::mutex readMutex_;
  bool callerReads_ = false;  // under mutex_, set while readMutex_ is held
  LumoFrameSplitter splitter_;
};

}  // namespace typhora
