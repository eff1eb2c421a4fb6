#include "platform/linux/lumo_connection.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/random.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <condition_variable>
#include <cstring>

#include "platform/linux/lumo_admission.h"
#include "platform/linux/lumo_endpoint.h"
#include "platform/linux/lumo_event_loop.h"
#include "platform/linux/lumo_proxy.h"
#include "platform/linux/scm_rights.h"
#include "platform/log.h"

namespace typhora {

struct LumoConnection::Pending {
  IpcReply onReply;
  IpcErrorHandler onError;
  bool synchronous = false;
  // Synchronous calls: the raw answer lands here and wakes the caller, who decodes it.
  std::mutex mutex;
  std::condition_variable answered;
  bool done = false;
  std::optional<LumoRawFrame> frame;
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
constexpr int kReadsPerTurn = 4;  // then other connections get the I/O thread
// Undispatched invocations at which a connection stops being read, and the hard bound on their
// bytes (reached only while a synchronous call keeps a connection read).
constexpr std::size_t kPauseInvocations = 64;
constexpr std::size_t kPauseBytes = 1u << 20;
constexpr std::size_t kHardUndispatchedBytes = 8u << 20;
// Answers waiting for a peer at which it stops being read: a peer that does not read its answers
// gets no more work done for it (the kernel holds its calls), and is cut off once they have not
// moved for kStalledPeerLimit.
constexpr std::size_t kPiledAnswersBytes = 1u << 20;
constexpr auto kStalledPeerLimit = std::chrono::seconds(5);
// While inbound memory is over its process-wide bound, a connection holding an unfinished frame
// larger than this is cut off: honest clients send small frames that complete at once.
constexpr std::size_t kLargePartialFrame = 64u << 10;
constexpr std::size_t kHelloMaxBytes = 256;
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

void finish(const std::shared_ptr<LumoConnection::Pending>& p, std::optional<LumoRawFrame> frame,
            std::string error) {
  std::lock_guard lock(p->mutex);
  p->frame = std::move(frame);
  p->error = std::move(error);
  p->done = true;
  p->answered.notify_all();
}

std::shared_ptr<const IpcEndpoint> makeEndpoint(UniqueFd fd) {
  return std::make_shared<const LumoEndpoint>(std::move(fd));
}

LumoMessage helloWith(const std::array<std::uint8_t, 16>& nonce) {
  return LumoMessage{LumoMessage::Kind::Hello,
                     0,
                     LumoConnection::kVersion,
                     {Value::data(std::vector<std::uint8_t>(nonce.begin(), nonce.end()))}};
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
}

std::shared_ptr<LumoConnection> LumoConnection::adopt(UniqueFd fd, ProcessPin peer) {
  auto connection = std::shared_ptr<LumoConnection>(new LumoConnection(false));
  setNonBlocking(fd.get());
  passCredentials(fd.get());
  connection->fd_ = std::move(fd);
  connection->pin_ = std::move(peer);
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
  LumoAdmission::shared().awaitHello(pin_.token().uid,
                                     std::static_pointer_cast<LumoConnection>(shared_from_this()));
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
    SystemLog(kLumoError, "-[LumoConnection resume]", error);
    end(error, false);
    return;
  }
  if (!outgoing_) greet();
  armHandshakeLimit();
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
    if (!readSome(&error)) {
      end(error, true);
      return;
    }
  }
  if (!error.empty()) end(error, true);
}

bool LumoConnection::readSome(std::string* error) {
  static thread_local std::vector<std::uint8_t> buffer(kReadChunk);
  for (int turn = 0; turn < kReadsPerTurn; ++turn) {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred)) + CMSG_SPACE(sizeof(int) * 16)];
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
    std::vector<UniqueFd> fds = takeDescriptors(&msg);
    if ((msg.msg_flags & MSG_CTRUNC) != 0) {
      refuseOnce(*error = "too many descriptors in one message");
      return false;
    }
    const std::optional<ucred> writer = takeCredentials(&msg);
    if (!checkWriter(writer.value_or(ucred{}), error)) return false;
    for (UniqueFd& fd : fds) splitter_.addDescriptor(std::move(fd));
    splitter_.addBytes({buffer.data(), static_cast<std::size_t>(n)});
    for (;;) {
      LumoRawFrame frame;
      std::string why;
      auto status = splitter_.next(&frame, &why);
      if (status == LumoFrameSplitter::Status::NeedMore) break;
      if (status == LumoFrameSplitter::Status::Malformed) {
        refuseOnce(*error = why);
        return false;
      }
      if (!takeFrame(std::move(frame), error)) return false;
    }
    std::lock_guard lock(mutex_);
    splitterBytes_ = splitter_.bufferedBytes();
    if (splitter_.heldDescriptors() + undispatchedDescriptors_ >
        LumoAdmission::shared().limits().descriptorsPerConnection) {
      *error = "the peer holds too many descriptors";
    } else if (undispatchedBytes_ > kHardUndispatchedBytes) {
      *error = "the peer sent more than the connection buffers";
    } else if (splitter_.bufferedBytes() > kLargePartialFrame &&
               LumoAdmission::shared().inboundOverLimit()) {
      *error = "inbound memory over its bound; a large unfinished frame is cut off";
    }
    if (!error->empty()) {
      LumoAdmission::shared().logOnce("inbound", pin_.token().uid, *error);
      return false;
    }
    updateInboundLocked();
    if (readHeldLocked()) return true;
  }
  return true;
}

bool LumoConnection::checkWriter(const ucred& writer, std::string* error) {
  const pid_t pid = writer.pid;
  const uid_t uid = writer.uid;
  std::lock_guard lock(mutex_);
  if (pid <= 0) {
    *error = "a read without its writer's credentials";
  } else if (outgoing_ && handshake_ == Handshake::AwaitingHello && !pin_.pinned()) {
    // The Hello's writer becomes the peer; every later read must come from it.
    pin_ = ProcessPin::ofWriter(pid, uid, writer.gid);
    if (!pin_.pinned()) *error = "the peer that wrote the hello cannot be identified";
  } else if (pid != pin_.token().pid || uid != pin_.token().uid) {
    *error = "a frame written by process " + std::to_string(pid) + ", not by the peer " +
             std::to_string(pin_.token().pid);
  }
  if (error->empty()) return true;
  if (!refusalLogged_) {
    refusalLogged_ = true;
    SystemLog(kLumoError, "-[LumoConnection read]", *error);
  }
  return false;
}

bool LumoConnection::takeFrame(LumoRawFrame frame, std::string* error) {
  Handshake handshake;
  {
    std::lock_guard lock(mutex_);
    handshake = handshake_;
  }
  if (handshake != Handshake::Done || frame.kind == LumoMessage::Kind::Hello) {
    if (handshake == Handshake::Done || frame.kind != LumoMessage::Kind::Hello) {
      refuseOnce(*error = handshake == Handshake::Done ? "a second hello"
                                                       : "a frame written before the hello");
      return false;
    }
    return takeHello(std::move(frame), error);
  }
  if (frame.kind != LumoMessage::Kind::Invoke) {
    routeReply(std::move(frame));
    return true;
  }
  std::lock_guard lock(mutex_);
  ++undispatched_;
  undispatchedBytes_ += frame.payload.size();
  undispatchedDescriptors_ += frame.descriptors.size();
  if ((undispatched_ >= kPauseInvocations || undispatchedBytes_ >= kPauseBytes) &&
      synchronousWaiting_ == 0 && !readPaused_) {
    readPaused_ = true;
    updateInterestLocked();
  }
  auto self = std::static_pointer_cast<LumoConnection>(shared_from_this());
  // Jobs are copyable; the frame's descriptors are not.
  auto held = std::make_shared<LumoRawFrame>(std::move(frame));
  queue_->async([self, held] { self->handleInvoke(std::move(*held)); });
  return true;
}

bool LumoConnection::takeHello(LumoRawFrame frame, std::string* error) {
  if (frame.payload.size() > kHelloMaxBytes || !frame.descriptors.empty()) {
    refuseOnce(*error = "a malformed hello");
    return false;
  }
  std::optional<LumoMessage> hello = decodeLumoFrame(std::move(frame), limits_, nullptr, error);
  const std::vector<std::uint8_t>* nonce =
      hello && hello->values.size() == 1 ? hello->values[0].asData() : nullptr;
  if (nonce == nullptr || nonce->size() != nonce_.size()) {
    refuseOnce(*error = "a malformed hello");
    return false;
  }
  if (hello->text != kVersion) {
    refuseOnce(*error = "a peer speaking " + hello->text + ", not " + kVersion);
    return false;
  }
  std::lock_guard lock(mutex_);
  if (outgoing_) {
    // Answer with the nonce before anything held back goes out.
    std::copy(nonce->begin(), nonce->end(), nonce_.begin());
    auto ack = std::make_unique<Outgoing>();
    std::vector<int> none;
    encodeLumoFrame(helloWith(nonce_), &ack->bytes, &none, nullptr, error);
    handshake_ = Handshake::Done;
    handshakeDone_.notify_all();
    return enqueueLocked(std::move(ack), true, error);
  }
  if (!std::equal(nonce->begin(), nonce->end(), nonce_.begin())) {
    *error = "a hello that does not carry this connection's nonce";
    if (!refusalLogged_) {
      refusalLogged_ = true;
      SystemLog(kLumoError, "-[LumoConnection read]", *error);
    }
    return false;
  }
  handshake_ = Handshake::Done;
  handshakeDone_.notify_all();
  LumoAdmission::shared().helloDone(pin_.token().uid, this);
  return true;
}

void LumoConnection::routeReply(LumoRawFrame frame) {
  std::shared_ptr<Pending> pending;
  {
    std::lock_guard lock(mutex_);
    auto it = pending_.find(frame.id);
    if (it == pending_.end()) return;  // an answer nobody waits for
    pending = std::move(it->second);
    pending_.erase(it);
  }
  if (pending->synchronous) return finish(pending, std::move(frame), "");
  auto self = std::static_pointer_cast<LumoConnection>(shared_from_this());
  auto held = std::make_shared<LumoRawFrame>(std::move(frame));
  queue_->async([self, pending, held] {
    std::string error;
    std::optional<LumoMessage> message = self->decode(std::move(*held), &error);
    CurrentScope scope(self);
    if (!message || message->kind == LumoMessage::Kind::Error) {
      if (pending->onError) pending->onError(message ? message->text : error);
    } else if (pending->onReply) {
      pending->onReply(std::move(message->values));
    }
  });
}

std::optional<LumoMessage> LumoConnection::decode(LumoRawFrame frame, std::string* error) {
  std::optional<LumoMessage> message =
      decodeLumoFrame(std::move(frame), limits_, &makeEndpoint, error);
  if (!message) SystemLog(kLumoError, "-[LumoConnection decode]", *error);
  return message;
}

void LumoConnection::updateInboundLocked() {
  const std::size_t held = (valid_ ? splitterBytes_ : 0) + undispatchedBytes_;
  LumoAdmission::shared().addInbound(static_cast<std::ptrdiff_t>(held) -
                                     static_cast<std::ptrdiff_t>(inboundAccounted_));
  inboundAccounted_ = held;
}

void LumoConnection::updateInterestLocked() {
  if (!resumed_ || !valid_ || !fd_.valid()) return;
  std::uint32_t events = watchingWrites_ ? std::uint32_t{EPOLLOUT} : 0u;
  if (!readHeldLocked()) events |= EPOLLIN | EPOLLRDHUP;
  LumoEventLoop::shared().modify(fd_.get(), events);
}

void LumoConnection::dispatched(std::size_t bytes, std::size_t descriptors) {
  std::lock_guard lock(mutex_);
  --undispatched_;
  undispatchedBytes_ -= bytes;
  undispatchedDescriptors_ -= descriptors;
  if (readPaused_ && undispatched_ <= kPauseInvocations / 2 &&
      undispatchedBytes_ <= kPauseBytes / 2) {
    readPaused_ = false;
    updateInterestLocked();
  }
  updateInboundLocked();
}

void LumoConnection::handleInvoke(LumoRawFrame frame) {
  struct Done {
    LumoConnection* self;
    std::size_t bytes;
    std::size_t descriptors;
    ~Done() { self->dispatched(bytes, descriptors); }
  } done{this, frame.payload.size(), frame.descriptors.size()};

  std::shared_ptr<const IpcInterface> interface;
  std::shared_ptr<IpcExportedObject> object;
  {
    std::lock_guard lock(mutex_);
    // Calls of a connection that ended are dropped: nobody is left to answer. One-way messages
    // that arrived before the peer closed are still served: a one-way call followed at once by
    // the sender's exit must not be lost.
    if (!valid_ && !(servingAfterPeerClosed_ && frame.id == 0)) return;
    interface = exportedInterface_;
    object = exportedObject_;
  }
  // A peer that exec'd speaks no more for the program it was identified with. One that has
  // ended is still heard: its last one-way messages were written while it ran.
  if (!outgoing_ && pin_.state() == ProcessPin::State::Changed) {
    refuseOnce("the peer runs another program than the one it was identified with");
    end("the peer runs another program", false);
    return;
  }
  std::string error;
  std::optional<LumoMessage> decoded = decode(std::move(frame), &error);
  if (!decoded) {
    end(error, false);
    return;
  }
  const LumoMessage& message = *decoded;
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
        auto connection = weak.lock();
        if (!connection || !connection->isValid()) return;  // nobody is left to read it
        std::string sendError;
        LumoMessage answer{LumoMessage::Kind::Reply, id, "", std::move(values)};
        if (!connection->send(answer, &sendError)) {
          SystemLog(kLumoError, "-[LumoConnection reply]", sendError);
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

void LumoConnection::refuseOnce(const std::string& why) {
  {
    std::lock_guard lock(mutex_);
    if (refusalLogged_) return;
    refusalLogged_ = true;
  }
  SystemLog(kLumoError, "-[LumoConnection read]", why);
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
    cutOff = !enqueueLocked(std::move(out), false, error);
  }
  if (cutOff) {
    if (error->empty()) *error = "the peer stopped reading; cut off";
    SystemLog(kLumoError, "-[LumoConnection send]", *error);
    end(*error, false);
    return false;
  }
  return true;
}

bool LumoConnection::enqueueLocked(std::unique_ptr<Outgoing> out, bool first, std::string* error) {
  if (outboundBytes_ + out->bytes.size() > kOutboundLimit) return false;
  outboundBytes_ += out->bytes.size();
  const bool piledNow = !answersPiled_ && outboundBytes_ > kPiledAnswersBytes;
  if (piledNow) {
    answersPiled_ = true;
    updateInterestLocked();
  }
  if (first && !outbound_.empty() && outbound_.front()->offset == 0) {
    outbound_.push_front(std::move(out));
  } else if (first) {
    outbound_.insert(outbound_.begin() + (outbound_.empty() ? 0 : 1), std::move(out));
  } else {
    outbound_.push_back(std::move(out));
  }
  const bool ok = flushLocked(error);
  // Timed from what the peer took of the answers now, not from before they went out.
  if (piledNow && answersPiled_) watchForStall(outboundSent_);
  return ok;
}

bool LumoConnection::flushLocked(std::string* error) {
  // A connecting side says nothing before the peer's Hello has come and been answered.
  const bool held = outgoing_ && handshake_ != Handshake::Done;
  while (!outbound_.empty() && !held) {
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
    outboundSent_ += static_cast<std::size_t>(n);
    if (front.offset == front.bytes.size()) {
      outboundBytes_ -= front.bytes.size();
      outbound_.pop_front();
    }
  }
  const bool wantWrites = !outbound_.empty() && !held;
  if (outbound_.empty()) sent_.notify_all();
  if (answersPiled_ && outboundBytes_ <= kPiledAnswersBytes / 2) {
    answersPiled_ = false;
    updateInterestLocked();
  }
  if (wantWrites != watchingWrites_ && resumed_) {
    watchingWrites_ = wantWrites;
    updateInterestLocked();
  }
  return true;
}

void LumoConnection::watchForStall(std::size_t sentBefore) {
  std::weak_ptr<LumoConnection> weak = std::static_pointer_cast<LumoConnection>(shared_from_this());
  queue_->asyncAfter(kStalledPeerLimit, [weak, sentBefore] {
    auto self = weak.lock();
    if (!self) return;
    {
      std::lock_guard lock(self->mutex_);
      if (!self->answersPiled_ || !self->valid_) return;
      if (self->outboundSent_ != sentBefore) return self->watchForStall(self->outboundSent_);
    }
    const std::string why = "the peer stopped reading; cut off";
    SystemLog(kLumoError, "-[LumoConnection send]", why);
    self->end(why, false);
  });
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
  const bool waits = synchronous && op->replies;
  if (op->replies) {
    std::lock_guard lock(mutex_);
    if (!valid_) {
      why = "the connection is not open";
    } else {
      id = nextId_++;
      pending_[id] = pending;
      const bool held = readHeldLocked();
      if (waits && ++synchronousWaiting_ == 1 && held) {
        // The answer may sit behind the invocations that paused reading.
        readPaused_ = false;
        updateInterestLocked();
      }
    }
  }
  if (why.empty() &&
      !send(LumoMessage{LumoMessage::Kind::Invoke, id, wireName, std::move(arguments)}, &why)) {
    std::lock_guard lock(mutex_);
    pending_.erase(id);
  }
  if (waits && id != 0) {
    if (why.empty()) {
      std::unique_lock lock(pending->mutex);
      pending->answered.wait(lock, [&] { return pending->done; });
    }
    std::lock_guard lock(mutex_);
    if (--synchronousWaiting_ == 0 && answersPiled_) updateInterestLocked();
  }
  if (!why.empty()) {
    if (onError) onError(why);
    return;
  }
  if (!waits) return;
  std::optional<LumoRawFrame> frame = std::move(pending->frame);
  std::string error = pending->error;
  std::optional<LumoMessage> message;
  if (frame) {
    message = decode(std::move(*frame), &error);
    if (message && message->kind == LumoMessage::Kind::Error) error = message->text;
  }
  CurrentScope scope(shared_from_this());
  if (message && message->kind != LumoMessage::Kind::Error) {
    if (pending->onReply) pending->onReply(std::move(message->values));
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

}  // namespace typhora
