// A lumo connection's lifecycle: how it is made (accepted, or opened to a path or an endpoint),
// its handshake's start and time limit, resume, and its one end.
#include "platform/linux/lumo/lumo_connection.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/random.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_connection_parts.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/linux/lumo/lumo_peer_log.h"
#include "platform/linux/lumo/transport/lumo_event_loop.h"
#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/log/log.h"

namespace typhora {

using lumo_detail::finish;
using lumo_detail::helloWith;

namespace {

// How long a peer may owe its hello. A service holds a slot for each such peer (and evicts
// silent ones when the slots run out), so its limit is short; a client waiting for a busy
// service loses nothing but time, so its limit is long.
constexpr auto kAcceptedHandshakeLimit = std::chrono::seconds(10);
constexpr auto kOutgoingHandshakeLimit = std::chrono::seconds(30);

std::mutex limitsMutex;
LumoLimits processInboundLimits;

void setNonBlocking(int fd) {
  fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
}

void passCredentials(int fd) {
  int on = 1;
  setsockopt(fd, SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
}

}  // namespace

void LumoConnection::setInboundLimits(const LumoLimits& limits) {
  std::lock_guard lock(limitsMutex);
  processInboundLimits = limits;
}

LumoLimits LumoConnection::inboundLimits() {
  std::lock_guard lock(limitsMutex);
  return processInboundLimits;
}

LumoConnection::LumoConnection(bool outgoing)
    : outgoing_(outgoing),
      limits_(inboundLimits()),
      queue_(SerialQueue::create("com.zorvane.lumo.connection")),
      splitter_(limits_) {}

LumoConnection::~LumoConnection() {
  if (fd_.valid()) LumoEventLoop::shared().remove(fd_.get());
  LumoAdmission::shared().addInbound(-static_cast<std::ptrdiff_t>(inboundAccounted_));
  // An accepted connection dropped without ever ending still gives back its slots.
  if (!outgoing_ && handshake_ != Handshake::Done) {
    LumoAdmission::shared().helloDone(pin_.token().uid, this);
  }
  if (admitted_) LumoAdmission::shared().release(pin_.token().uid);
}

std::shared_ptr<LumoConnection> LumoConnection::adopt(UniqueFd fd, ProcessPin peer) {
  auto connection = std::shared_ptr<LumoConnection>(new LumoConnection(false));
  setNonBlocking(fd.get());
  passCredentials(fd.get());
  connection->fd_ = std::move(fd);
  connection->pin_ = std::move(peer);
  connection->peerUid_ = connection->pin_.token().uid;
  connection->admitted_ = true;
  connection->handshake_ = Handshake::AwaitingAck;
  getrandom(connection->nonce_.data(), connection->nonce_.size(), 0);
  return connection;
}

void LumoConnection::greet() {
  // The peer's identity is read and the connection is read from now on: its frames may count
  // once they carry the nonce. The hello goes out only now, so a peer's handshake never waits on
  // the listener's delegate, and a client opening connections one handshake at a time is paced
  // by how fast they are admitted.
  LumoAdmission::shared().helloSent(pin_.token().uid, this);
  std::string error;
  send(helloWith(nonce_), &error);
}

std::shared_ptr<LumoConnection> LumoConnection::toPath(std::string path) {
  auto connection = std::shared_ptr<LumoConnection>(new LumoConnection(true));
  connection->path_ = std::move(path);
  return connection;
}

std::shared_ptr<LumoConnection> LumoConnection::toEndpoint(
    std::shared_ptr<const IpcEndpoint> endpoint) {
  auto connection = std::shared_ptr<LumoConnection>(new LumoConnection(true));
  connection->endpoint_ = std::move(endpoint);
  return connection;
}

void LumoConnection::setExportedInterface(std::shared_ptr<const IpcInterface> interface) {
  std::lock_guard lock(mutex_);
  exportedInterface_ = std::move(interface);
}
void LumoConnection::setExportedObject(std::shared_ptr<IpcExportedObject> object) {
  std::lock_guard lock(mutex_);
  if (valid_) exportedObject_ = std::move(object);
}
void LumoConnection::setRemoteInterface(std::shared_ptr<const IpcInterface> interface) {
  std::lock_guard lock(mutex_);
  remoteInterface_ = std::move(interface);
}
void LumoConnection::setInvalidationHandler(std::function<void()> handler) {
  std::lock_guard lock(mutex_);
  if (valid_) invalidationHandler_ = std::move(handler);
}
void LumoConnection::setInterruptionHandler(std::function<void()> handler) {
  std::lock_guard lock(mutex_);
  if (valid_) interruptionHandler_ = std::move(handler);
}

bool LumoConnection::isValid() const {
  std::lock_guard lock(mutex_);
  return valid_;
}

AuditToken LumoConnection::auditToken() const {
  std::unique_lock lock(mutex_);
  if (outgoing_ && resumed_) {
    handshakeDone_.wait_for(lock, kOutgoingHandshakeLimit,
                            [this] { return handshake_ == Handshake::Done || !valid_; });
  }
  return pin_.token();
}

bool LumoConnection::connectNow(std::string* error) {
  int pair[2] = {-1, -1};
  if (endpoint_) {
    auto* lumo = dynamic_cast<const LumoEndpoint*>(endpoint_.get());
    if (lumo == nullptr) return *error = "not a lumo endpoint", false;
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
      return *error = std::strerror(errno), false;
    }
    UniqueFd ours(pair[0]);
    UniqueFd theirs(pair[1]);
    passCredentials(ours.get());
    char byte = 'c';
    iovec iov{&byte, 1};
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    std::vector<char> control;
    attachDescriptors(&msg, &control, {theirs.get()});
    if (sendmsg(lumo->fd(), &msg, MSG_NOSIGNAL | MSG_DONTWAIT) != 1) {
      return *error = std::string("the endpoint's listener is gone: ") + std::strerror(errno),
             false;
    }
    fd_ = std::move(ours);
  } else {
    UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    passCredentials(fd.get());
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path_.size() >= sizeof address.sun_path) return *error = "socket path too long", false;
    std::memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
    if (connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
      return *error = "cannot connect to " + path_ + ": " + std::strerror(errno), false;
    }
    fd_ = std::move(fd);
  }
  setNonBlocking(fd_.get());
  return true;
}

void LumoConnection::armHandshakeLimit() {
  std::weak_ptr<LumoConnection> weak = std::static_pointer_cast<LumoConnection>(shared_from_this());
  queue_->asyncAfter(outgoing_ ? kOutgoingHandshakeLimit : kAcceptedHandshakeLimit, [weak] {
    auto self = weak.lock();
    if (!self) return;
    {
      std::lock_guard lock(self->mutex_);
      if (self->handshake_ == Handshake::Done) return;
    }
    self->refuseOnce("no hello in time");
    self->end("no hello in time", false);
  });
}

void LumoConnection::resume() {
  std::string error;
  {
    std::lock_guard lock(mutex_);
    if (resumed_ || !valid_) return;
    resumed_ = true;
    if (outgoing_ && !connectNow(&error)) {
      // fall through to end() outside the lock
    } else {
      // The loop holds the connection while it is open; end() lets go.
      auto self = std::static_pointer_cast<LumoConnection>(shared_from_this());
      LumoEventLoop::shared().add(fd_.get(), EPOLLIN | EPOLLRDHUP,
                                  [self](std::uint32_t events) { self->onEvents(events); });
      // Frames written before the loop watched the socket.
      updateInterestLocked();
    }
  }
  if (!error.empty()) {
    peerError("-[LumoConnection resume]", error);
    end(error, false);
    return;
  }
  if (!outgoing_) greet();
  armHandshakeLimit();
}

void LumoConnection::invalidate() {
  end("invalidated", false);
}

void LumoConnection::end(const std::string& reason, bool peerWentAway) {
  std::map<std::uint64_t, std::shared_ptr<Pending>> pending;
  std::function<void()> invalidation;
  std::function<void()> interruption;
  std::shared_ptr<IpcExportedObject> object;
  bool wasAdmitted = false;
  bool helloPending = false;
  {
    std::lock_guard lock(mutex_);
    if (!valid_) return;
    // Closing our side: what the socket still takes goes out first, so a last one-way message
    // sent just before invalidate() is not lost.
    std::string ignored;
    if (!peerWentAway && fd_.valid()) flushLocked(&ignored);
    valid_ = false;
    handshakeDone_.notify_all();
    pending.swap(pending_);
    invalidation = std::move(invalidationHandler_);
    interruption = std::move(interruptionHandler_);
    // After the peer closed, the messages queued before the end still need the object; the end
    // job lets go of it.
    servingAfterPeerClosed_ = peerWentAway;
    if (!peerWentAway) object = std::move(exportedObject_);
    droppedOutbound_ = !outbound_.empty();
    outbound_.clear();
    sent_.notify_all();
    LumoAdmission::shared().addOutbound(-static_cast<std::ptrdiff_t>(outboundBytes_));
    outboundBytes_ = 0;
    updateInboundLocked();
    wasAdmitted = std::exchange(admitted_, false);
    helloPending = !outgoing_ && handshake_ != Handshake::Done;
    if (fd_.valid()) {
      LumoEventLoop::shared().remove(fd_.get());
      shutdown(fd_.get(), SHUT_RDWR);
    }
  }
  if (helloPending) LumoAdmission::shared().helloDone(pin_.token().uid, this);
  if (wasAdmitted) LumoAdmission::shared().release(pin_.token().uid);
  const bool interrupted = peerWentAway && outgoing_ && !pending.empty();
  for (auto& [id, p] : pending) {
    if (p->synchronous) finish(p, std::nullopt, "connection invalidated: " + reason);
  }
  auto self = std::static_pointer_cast<LumoConnection>(shared_from_this());
  // Handlers run on the connection's queue, after every message already queued; then the
  // connection lets go of them and of its exported object, which breaks ownership cycles.
  queue_->async([self, pending = std::move(pending), invalidation = std::move(invalidation),
                 interruption = std::move(interruption), object = std::move(object), interrupted,
                 reason]() mutable {
    for (auto& [id, p] : pending) {
      if (!p->synchronous && p->onError) p->onError("connection invalidated: " + reason);
    }
    if (interrupted && interruption) interruption();
    if (invalidation) invalidation();
    invalidation = nullptr;
    interruption = nullptr;
    object.reset();
    std::shared_ptr<IpcExportedObject> kept;
    {
      std::lock_guard lock(self->mutex_);
      self->servingAfterPeerClosed_ = false;
      kept = std::move(self->exportedObject_);
    }
  });
}

void LumoConnection::peerError(const char* where, const std::string& why) const {
  LumoPeerLog::shared().error(peerUid_.load(), where, why);
}

}  // namespace typhora
