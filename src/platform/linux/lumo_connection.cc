#include "platform/linux/lumo_connection.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <condition_variable>
#include <cstring>

#include "platform/linux/lumo_endpoint.h"
#include "platform/linux/lumo_event_loop.h"
#include "platform/linux/process_identity.h"
#include "platform/linux/scm_rights.h"
#include "platform/log.h"

namespace typhora {

struct LumoConnection::Pending {
  IpcReply onReply;
  IpcErrorHandler onError;
  bool synchronous = false;
  // Synchronous calls: the answer lands here and wakes the caller.
  std::mutex mutex;
  std::condition_variable answered;
  bool done = false;
  std::optional<std::vector<Value>> reply;
  std::string error;
};

struct LumoConnection::Outgoing {
  std::vector<std::uint8_t> bytes;
  std::vector<UniqueFd> fds;  // sent beside the first byte, then closed
  std::size_t offset = 0;
};

namespace {

constexpr const char* kLumoError = "lumo error: %s - %@";
constexpr std::size_t kReadChunk = 64 * 1024;

void setNonBlocking(int fd) {
  fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
}

void finish(const std::shared_ptr<LumoConnection::Pending>& p,
            std::optional<std::vector<Value>> reply, std::string error) {
  std::lock_guard lock(p->mutex);
  p->reply = std::move(reply);
  p->error = std::move(error);
  p->done = true;
  p->answered.notify_all();
}

class LumoProxy final : public IpcRemoteProxy {
 public:
  LumoProxy(std::weak_ptr<LumoConnection> connection, IpcErrorHandler onError, bool synchronous)
      : connection_(std::move(connection)),
        onError_(std::move(onError)),
        synchronous_(synchronous) {}

  void call(const std::string& wireName, std::vector<Value> arguments, IpcReply onReply) override {
    auto connection = connection_.lock();
    if (!connection) {
      if (onError_) onError_("the connection is gone");
      return;
    }
    connection->call(wireName, std::move(arguments), std::move(onReply), onError_, synchronous_);
  }

 private:
  std::weak_ptr<LumoConnection> connection_;
  IpcErrorHandler onError_;
  bool synchronous_;
};

}  // namespace

LumoConnection::LumoConnection(bool outgoing)
    : outgoing_(outgoing), queue_(SerialQueue::create("com.zorvane.lumo.connection")) {}

LumoConnection::~LumoConnection() {
  if (fd_.valid()) LumoEventLoop::shared().remove(fd_.get());
}

std::shared_ptr<LumoConnection> LumoConnection::adopt(UniqueFd fd) {
  auto connection = std::shared_ptr<LumoConnection>(new LumoConnection(false));
  setNonBlocking(fd.get());
  connection->peer_ = ProcessIdentity::ofSocketPeer(fd.get());
  connection->fd_ = std::move(fd);
  return connection;
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
  std::lock_guard lock(mutex_);
  return peer_;
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
  peer_ = ProcessIdentity::ofSocketPeer(fd_.get());
  return true;
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
      return;
    }
  }
  SystemLog(kLumoError, "-[LumoConnection resume]", error);
  end(error, false);
}

void LumoConnection::invalidate() {
  end("invalidated", false);
}

void LumoConnection::onEvents(std::uint32_t events) {
  std::string error;
  if ((events & EPOLLOUT) != 0) {
    std::lock_guard lock(mutex_);
    if (!flushLocked(&error)) {
      // reported below
    }
  }
  if (error.empty() && (events & (EPOLLIN | EPOLLHUP | EPOLLERR | EPOLLRDHUP)) != 0) {
    if (!readAvailable(&error)) {
      end(error, true);
      return;
    }
  }
  if (!error.empty()) {
    end(error, true);
  }
}

bool LumoConnection::readAvailable(std::string* error) {
  static thread_local std::vector<std::uint8_t> buffer(kReadChunk);
  for (;;) {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * 16)];
    iovec iov{buffer.data(), buffer.size()};
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    ssize_t n = recvmsg(fd_.get(), &msg, MSG_CMSG_CLOEXEC | MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return true;
    if (n <= 0) {
      *error = n == 0 ? "the peer closed the connection" : std::strerror(errno);
      return false;
    }
    for (UniqueFd& fd : takeDescriptors(&msg)) decoder_.addDescriptor(std::move(fd));
    if ((msg.msg_flags & MSG_CTRUNC) != 0) {
      *error = "too many descriptors in one message";
      SystemLog(kLumoError, "-[LumoConnection read]", *error);
      return false;
    }
    decoder_.addBytes({buffer.data(), static_cast<std::size_t>(n)});
    for (;;) {
      LumoMessage message;
      std::string why;
      auto status = decoder_.next(&message, &why, [](UniqueFd fd) {
        return std::make_shared<const LumoEndpoint>(std::move(fd));
      });
      if (status == LumoFrameDecoder::Status::NeedMore) break;
      if (status == LumoFrameDecoder::Status::Malformed) {
        SystemLog(kLumoError, "-[LumoConnection read]", why);
        *error = why;
        return false;
      }
      handleMessage(std::move(message));
    }
  }
}

void LumoConnection::handleMessage(LumoMessage message) {
  if (message.kind != LumoMessage::Kind::Invoke) return deliverReply(std::move(message));
  auto self = std::static_pointer_cast<LumoConnection>(shared_from_this());
  queue_->async([self, message = std::move(message)] { self->handleInvoke(message); });
}

void LumoConnection::handleInvoke(const LumoMessage& message) {
  std::shared_ptr<const IpcInterface> interface;
  std::shared_ptr<IpcExportedObject> object;
  {
    std::lock_guard lock(mutex_);
    // Messages that arrived before the peer closed are still served: a one-way call followed
    // at once by the sender's exit must not be lost.
    if (!valid_ && !servingAfterPeerClosed_) return;
    interface = exportedInterface_;
    object = exportedObject_;
  }
  const IpcOperation* op = interface ? interface->find(message.text) : nullptr;
  if (op == nullptr || object == nullptr)
    return refuse(message, "unknown operation " + message.text);
  std::string why;
  if (!IpcInterface::matches(*op, message.values, &why)) return refuse(message, why);

  IpcReply reply;
  if (op->replies && message.id != 0) {
    std::weak_ptr<LumoConnection> weak =
        std::static_pointer_cast<LumoConnection>(shared_from_this());
    auto once = std::make_shared<std::once_flag>();
    reply = [weak, once, id = message.id](std::vector<Value> values) {
      std::call_once(*once, [&] {
        if (auto connection = weak.lock()) {
          std::string error;
          LumoMessage answer{LumoMessage::Kind::Reply, id, "", std::move(values)};
          if (!connection->send(answer, &error)) {
            SystemLog(kLumoError, "-[LumoConnection reply]", error);
          }
        }
      });
    };
  } else if (op->replies) {
    reply = [](std::vector<Value>) {};
  }
  CurrentScope scope(shared_from_this());
  if (!object->invoke(*op, message.values, std::move(reply))) {
    refuse(message, "unrecognised operation " + message.text);
  }
}

void LumoConnection::refuse(const LumoMessage& message, const std::string& why) {
  SystemLog(kLumoError, "-[LumoConnection dispatch]", why);
  if (message.id == 0) return;
  std::string error;
  send(LumoMessage{LumoMessage::Kind::Error, message.id, why, {}}, &error);
}

void LumoConnection::deliverReply(LumoMessage message) {
  std::shared_ptr<Pending> pending;
  {
    std::lock_guard lock(mutex_);
    auto it = pending_.find(message.id);
    if (it == pending_.end()) return;  // an answer nobody waits for
    pending = std::move(it->second);
    pending_.erase(it);
  }
  const bool isError = message.kind == LumoMessage::Kind::Error;
  if (pending->synchronous) {
    if (isError) return finish(pending, std::nullopt, message.text);
    return finish(pending, std::move(message.values), "");
  }
  auto self = std::static_pointer_cast<LumoConnection>(shared_from_this());
  queue_->async([self, pending, isError, message = std::move(message)]() mutable {
    CurrentScope scope(self);
    if (isError) {
      if (pending->onError) pending->onError(message.text);
    } else if (pending->onReply) {
      pending->onReply(std::move(message.values));
    }
  });
}

bool LumoConnection::send(const LumoMessage& message, std::string* error) {
  auto out = std::make_unique<Outgoing>();
  std::vector<int> fds;
  auto fdOf = [](const std::shared_ptr<const IpcEndpoint>& endpoint) {
    auto* lumo = dynamic_cast<const LumoEndpoint*>(endpoint.get());
    return lumo != nullptr ? fcntl(lumo->fd(), F_DUPFD_CLOEXEC, 0) : -1;
  };
  const bool encoded = encodeLumoFrame(message, &out->bytes, &fds, fdOf, error);
  for (int fd : fds) out->fds.emplace_back(fd);
  if (!encoded) return false;
  bool cutOff = false;
  {
    std::lock_guard lock(mutex_);
    if (!valid_ || !fd_.valid()) return *error = "the connection is not open", false;
    if (outboundBytes_ + out->bytes.size() > kOutboundLimit) {
      cutOff = true;
    } else {
      outboundBytes_ += out->bytes.size();
      outbound_.push_back(std::move(out));
      if (!flushLocked(error)) cutOff = true;
    }
  }
  if (cutOff) {
    if (error->empty()) *error = "the peer stopped reading; cut off";
    SystemLog(kLumoError, "-[LumoConnection send]", *error);
    end(*error, false);
    return false;
  }
  return true;
}

bool LumoConnection::flushLocked(std::string* error) {
  while (!outbound_.empty()) {
    Outgoing& front = *outbound_.front();
    iovec iov{front.bytes.data() + front.offset, front.bytes.size() - front.offset};
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    std::vector<char> control;
    if (front.offset == 0) {
      std::vector<int> fds;
      for (const UniqueFd& fd : front.fds) fds.push_back(fd.get());
      attachDescriptors(&msg, &control, fds);
    }
    ssize_t n = sendmsg(fd_.get(), &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
    if (n < 0) {
      *error = std::strerror(errno);
      return false;
    }
    front.fds.clear();  // the descriptors went with the first byte
    front.offset += static_cast<std::size_t>(n);
    if (front.offset == front.bytes.size()) {
      outboundBytes_ -= front.bytes.size();
      outbound_.pop_front();
    }
  }
  const bool wantWrites = !outbound_.empty();
  if (!wantWrites) sent_.notify_all();
  if (wantWrites != watchingWrites_ && resumed_) {
    watchingWrites_ = wantWrites;
    const std::uint32_t events = EPOLLIN | EPOLLRDHUP | (wantWrites ? std::uint32_t{EPOLLOUT} : 0u);
    LumoEventLoop::shared().modify(fd_.get(), events);
  }
  return true;
}

bool LumoConnection::waitUntilSent(std::chrono::milliseconds timeout) {
  std::unique_lock lock(mutex_);
  sent_.wait_for(lock, timeout, [this] { return outbound_.empty() || !valid_; });
  return outbound_.empty() && !droppedOutbound_;
}

void LumoConnection::call(const std::string& wireName, std::vector<Value> arguments,
                          IpcReply onReply, IpcErrorHandler onError, bool synchronous) {
  std::shared_ptr<const IpcInterface> remote;
  {
    std::lock_guard lock(mutex_);
    remote = remoteInterface_;
  }
  const IpcOperation* op = remote ? remote->find(wireName) : nullptr;
  std::string why;
  if (op == nullptr) why = "the remote interface has no operation " + wireName;
  if (op != nullptr && !IpcInterface::matches(*op, arguments, &why)) op = nullptr;
  if (op == nullptr) {
    if (onError) onError(why);
    return;
  }
  auto pending = std::make_shared<Pending>();
  pending->onReply = std::move(onReply);
  pending->onError = onError;
  pending->synchronous = synchronous;
  std::uint64_t id = 0;
  if (op->replies) {
    std::lock_guard lock(mutex_);
    if (!valid_) {
      why = "the connection is not open";
    } else {
      id = nextId_++;
      pending_[id] = pending;
    }
  }
  if (why.empty() &&
      !send(LumoMessage{LumoMessage::Kind::Invoke, id, wireName, std::move(arguments)}, &why)) {
    std::lock_guard lock(mutex_);
    pending_.erase(id);
  }
  if (!why.empty()) {
    if (onError) onError(why);
    return;
  }
  if (!synchronous || id == 0) return;
  std::unique_lock lock(pending->mutex);
  pending->answered.wait(lock, [&] { return pending->done; });
  auto reply = std::move(pending->reply);
  std::string error = pending->error;
  lock.unlock();
  CurrentScope scope(shared_from_this());
  if (reply) {
    if (pending->onReply) pending->onReply(std::move(*reply));
  } else if (pending->onError) {
    pending->onError(error);
  }
}

std::shared_ptr<IpcRemoteProxy> LumoConnection::remoteObjectProxy(IpcErrorHandler errorHandler) {
  return std::make_shared<LumoProxy>(std::static_pointer_cast<LumoConnection>(shared_from_this()),
                                     std::move(errorHandler), false);
}

std::shared_ptr<IpcRemoteProxy> LumoConnection::synchronousRemoteObjectProxy(
    IpcErrorHandler errorHandler) {
  return std::make_shared<LumoProxy>(std::static_pointer_cast<LumoConnection>(shared_from_this()),
                                     std::move(errorHandler), true);
}

void LumoConnection::end(const std::string& reason, bool peerWentAway) {
  std::map<std::uint64_t, std::shared_ptr<Pending>> pending;
  std::function<void()> invalidation;
  std::function<void()> interruption;
  std::shared_ptr<IpcExportedObject> object;
  {
    std::lock_guard lock(mutex_);
    if (!valid_) return;
    valid_ = false;
    pending.swap(pending_);
    invalidation = std::move(invalidationHandler_);
    interruption = std::move(interruptionHandler_);
    // After the peer closed, the messages queued before the end still need the object; the end
    // job lets go of it.
    servingAfterPeerClosed_ = peerWentAway;
    if (!peerWentAway) object = std::move(exportedObject_);
    // Closing our side: what the socket still takes goes out first, so a last one-way message
    // sent just before invalidate() is not lost.
    std::string ignored;
    if (!peerWentAway && fd_.valid()) flushLocked(&ignored);
    droppedOutbound_ = !outbound_.empty();
    outbound_.clear();
    sent_.notify_all();
    outboundBytes_ = 0;
    if (fd_.valid()) {
      LumoEventLoop::shared().remove(fd_.get());
      shutdown(fd_.get(), SHUT_RDWR);
    }
  }
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

}  // namespace typhora
