// Writing a lumo connection: frames queued with a byte bound and written without blocking,
// calls correlated with their answers by id, and the proxies that make them.
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstring>

#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_connection_parts.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/linux/lumo/lumo_proxy.h"
#include "platform/linux/lumo/transport/lumo_event_loop.h"
#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/log/log.h"

namespace typhora {

using lumo_detail::kPeerClosed;

namespace {

// Answers waiting for a peer at which it stops being read: a peer that does not read its answers
// gets no more work done for it (the kernel holds its calls), and is cut off once they have not
// moved for kStalledPeerLimit.
constexpr std::size_t kPiledAnswersBytes = 1u << 20;
// Or this many messages: a megabyte of small answers is tens of thousands of calls served for a
// peer that takes none of them.
constexpr std::size_t kPiledAnswers = 256;
constexpr auto kStalledPeerLimit = std::chrono::seconds(5);

}  // namespace

bool LumoConnection::send(const LumoMessage& message, std::string* error) {
  auto out = std::make_unique<Outgoing>();
  std::vector<int> fds;
  auto fdOf = [](const std::shared_ptr<const IpcEndpoint>& endpoint) {
    auto* lumo = dynamic_cast<const LumoEndpoint*>(endpoint.get());
    return lumo != nullptr ? fcntl(lumo->fd(), F_DUPFD_CLOEXEC, 0) : -1;
  };
  const bool encoded = encodeLumoFrame(message, &out->bytes, &fds, fdOf, error, {}, &out->splices);
  for (int fd : fds) out->fds.emplace_back(fd);
  if (!encoded) return false;
  return sendFrame(std::move(out), error);
}

bool LumoConnection::sendFrame(std::unique_ptr<Outgoing> out, std::string* error) {
  bool cutOff = false;
  {
    std::lock_guard lock(mutex_);
    if (!valid_ || !fd_.valid()) return *error = "the connection is not open", false;
    cutOff = !enqueueLocked(std::move(out), false, error);
  }
  if (cutOff) {
    if (error->empty()) *error = "the peer stopped reading; cut off";
    // A peer that has gone is the connection's ordinary end, not worth a line.
    if (*error != kPeerClosed) peerError("-[LumoConnection send]", *error);
    end(*error, false);
    return false;
  }
  return true;
}

bool LumoConnection::enqueueLocked(std::unique_ptr<Outgoing> out, bool first, std::string* error) {
  const std::size_t size = out->size();
  if (outboundBytes_ + size > kOutboundLimit) return false;
  // Many peers that do not read could each pile answers up to the connection's limit: past the
  // process's bound, one whose pile this answer would grow is cut off rather than given more. A
  // peer with nothing waiting always gets its answer, however large.
  const bool piles = !outbound_.empty() && outboundBytes_ + size > kPiledAnswersBytes;
  if (piles && LumoAdmission::shared().outboundOverLimit(size)) {
    *error = "answers waiting for peers over their bound; cut off";
    return false;
  }
  outboundBytes_ += size;
  LumoAdmission::shared().addOutbound(static_cast<std::ptrdiff_t>(size));
  const bool piledNow = !answersPiled_ && (outboundBytes_ > kPiledAnswersBytes ||
                                           outbound_.size() + 1 > kPiledAnswers);
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
    const std::size_t size = front.size();
    std::array<iovec, 16> iov;
    msghdr msg{};
    msg.msg_iov = iov.data();
    msg.msg_iovlen = front.unsent(iov.data(), iov.size());
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
      *error = errno == EPIPE || errno == ECONNRESET ? kPeerClosed : std::strerror(errno);
      return false;
    }
    front.fds.clear();  // the descriptors went with the first byte
    front.offset += static_cast<std::size_t>(n);
    outboundSent_ += static_cast<std::size_t>(n);
    if (front.offset == size) {
      outboundBytes_ -= size;
      LumoAdmission::shared().addOutbound(-static_cast<std::ptrdiff_t>(size));
      outbound_.pop_front();
    }
  }
  const bool wantWrites = !outbound_.empty() && !held;
  if (outbound_.empty()) sent_.notify_all();
  if (answersPiled_ && outboundBytes_ <= kPiledAnswersBytes / 2 &&
      outbound_.size() <= kPiledAnswers / 2) {
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
    self->peerError("-[LumoConnection send]", why);
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
  // Taken before the request goes out, so the answer cannot reach the I/O thread first.
  const bool reads = waits && takeReading();
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
  if (reads && why.empty() && id != 0) readUntilAnswered(*pending);
  if (reads) releaseReading();
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

}  // namespace typhora
