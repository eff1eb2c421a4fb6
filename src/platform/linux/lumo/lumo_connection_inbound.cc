// Reading a lumo connection: on the I/O thread, a budget of reads per turn, the writer's
// credentials checked on every read, frames cut and handed on; on the connection's queue,
// invocations decoded, refused or handled, and reading resumed once the queue catches up.
#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_connection_parts.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/linux/lumo/transport/lumo_event_loop.h"
#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/log/log.h"

namespace typhora {

using lumo_detail::finish;
using lumo_detail::helloWith;
using lumo_detail::kPeerClosed;

namespace {

constexpr std::size_t kReadChunk = 64 * 1024;
constexpr int kReadsPerTurn = 4;  // then other connections get the I/O thread
// Undispatched invocations at which a connection stops being read, and the hard bound on their
// bytes (reached only while a synchronous call keeps a connection read).
constexpr std::size_t kPauseInvocations = 64;
constexpr std::size_t kPauseBytes = 1u << 20;
constexpr std::size_t kHardUndispatchedBytes = 8u << 20;
// While inbound memory is over its process-wide bound, a connection holding an unfinished frame
// larger than this is cut off: honest clients send small frames that complete at once.
constexpr std::size_t kLargePartialFrame = 64u << 10;
constexpr std::size_t kHelloMaxBytes = 256;

std::shared_ptr<const IpcEndpoint> makeEndpoint(UniqueFd fd) {
  return std::make_shared<const LumoEndpoint>(std::move(fd));
}

}  // namespace

void LumoConnection::onEvents(std::uint32_t events) {
  std::string error;
  if ((events & EPOLLOUT) != 0) {
    std::lock_guard lock(mutex_);
    if (!flushLocked(&error)) {
      // reported below
    }
  }
  if (error.empty() && (events & (EPOLLIN | EPOLLHUP | EPOLLERR | EPOLLRDHUP)) != 0) {
    std::unique_lock read(readMutex_);
    bool standAside = false;
    {
      std::lock_guard lock(mutex_);
      standAside = callerReads_;
    }
    if (!standAside && !readSome(&error)) {
      read.unlock();
      end(error, true);
      return;
    }
  }
  if (!error.empty()) end(error, true);
}

bool LumoConnection::takeReading() {
  // Set under readMutex_: a read the I/O thread has begun ends first, and it took nothing sent
  // after the call's request; every later one sees the flag.
  std::lock_guard read(readMutex_);
  std::lock_guard lock(mutex_);
  if (callerReads_ || !resumed_ || !valid_ || !fd_.valid()) return false;
  callerReads_ = true;
  updateInterestLocked();
  return true;
}

void LumoConnection::readUntilAnswered(Pending& pending) {
  int fd = -1;
  {
    std::lock_guard lock(mutex_);
    fd = fd_.get();  // set before resume, closed only with the connection
  }
  for (;;) {
    {
      std::lock_guard lock(pending.mutex);
      if (pending.done) return;
    }
    // The end of the connection shuts the socket down, which wakes the poll; the time limit is
    // only a second safety for an end that raced the check above.
    pollfd ready{fd, POLLIN | POLLRDHUP, 0};
    const int n = poll(&ready, 1, 200);
    if (n < 0 && errno != EINTR) return;
    if (n <= 0) continue;
    std::string error;
    bool ok = true;
    {
      std::lock_guard read(readMutex_);
      ok = readSome(&error);
    }
    if (!ok) {
      end(error, true);
      return;
    }
  }
}

void LumoConnection::releaseReading() {
  std::lock_guard lock(mutex_);
  callerReads_ = false;
  // What came after the answer (calls of the peer, later answers) is the I/O thread's again;
  // re-arming a readable socket reports it at once.
  updateInterestLocked();
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
      *error = n == 0 ? kPeerClosed : std::strerror(errno);
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
    peerUid_ = pin_.token().uid;
    if (!pin_.pinned()) *error = "the peer that wrote the hello cannot be identified";
  } else if (pid != pin_.token().pid || uid != pin_.token().uid) {
    *error = "a frame written by process " + std::to_string(pid) + ", not by the peer " +
             std::to_string(pin_.token().pid);
  }
  if (error->empty()) return true;
  if (!refusalLogged_) {
    refusalLogged_ = true;
    peerError("-[LumoConnection read]", *error);
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
  const bool answerAwaited = frame.id != 0;
  auto held = std::make_shared<LumoRawFrame>(std::move(frame));
  SerialQueue::Job job = [self, held] { self->handleInvoke(std::move(*held)); };
  // A call's answer is awaited, so the hand-off saved is on the caller's path. A one-way message
  // has nobody waiting, and under a burst of them (a font change fanned out) a hand-off per
  // frame costs more wake-ups than the pool, whose workers stay awake across the burst.
  if (answerAwaited) {
    toQueue(std::move(job));
  } else {
    queue_->async(std::move(job));
  }
  return true;
}

void LumoConnection::toQueue(SerialQueue::Job job) {
  // On the loop's leader, an idle queue is run by this very thread once it has passed the lead
  // on: the frame waits for no worker's wake-up. Elsewhere (a synchronous caller reading for
  // itself, a busy queue, every loop thread already running work) it goes the usual way.
  LumoEventLoop& loop = LumoEventLoop::shared();
  if (!loop.canRunAfterHandoff()) return queue_->async(std::move(job));
  if (queue_->asyncClaiming(std::move(job))) {
    loop.runAfterHandoff([queue = queue_] { queue->drainClaimed(); });
  }
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
      peerError("-[LumoConnection read]", *error);
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
  toQueue([self, pending, held] {
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
  if (!message) peerError("-[LumoConnection decode]", *error);
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
  if (!readHeldLocked() && !callerReads_) events |= EPOLLIN | EPOLLRDHUP;
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
          connection->peerError("-[LumoConnection reply]", sendError);
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
  peerError("-[LumoConnection dispatch]", why);
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
  peerError("-[LumoConnection read]", why);
}

}  // namespace typhora
