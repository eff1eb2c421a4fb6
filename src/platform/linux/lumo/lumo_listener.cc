#include "platform/linux/lumo/lumo_listener.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/linux/lumo/transport/lumo_event_loop.h"
#include "platform/linux/lumo/transport/scm_rights.h"
#include "platform/log/log.h"

namespace typhora {

std::shared_ptr<LumoListener> LumoListener::named(UniqueFd fd, std::string path) {
  auto listener = std::shared_ptr<LumoListener>(new LumoListener());
  listener->fd_ = std::move(fd);
  listener->path_ = std::move(path);
  return listener;
}

std::shared_ptr<LumoListener> LumoListener::anonymous() {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, pair) != 0) {
    return nullptr;
  }
  auto listener = std::shared_ptr<LumoListener>(new LumoListener());
  listener->anonymous_ = true;
  listener->fd_.reset(pair[0]);
  listener->endpoint_ = std::make_shared<const LumoEndpoint>(UniqueFd(pair[1]));
  return listener;
}

void LumoListener::setDelegate(std::weak_ptr<IpcListenerDelegate> delegate) {
  std::lock_guard lock(mutex_);
  delegate_ = std::move(delegate);
}

void LumoListener::resume() {
  std::lock_guard lock(mutex_);
  if (resumed_ || !valid_ || !fd_.valid()) return;
  resumed_ = true;
  // The loop keeps a resumed listener alive until it is invalidated.
  auto self = shared_from_this();
  LumoEventLoop::shared().add(fd_.get(), EPOLLIN, [self](std::uint32_t) { self->onReadable(); });
}

void LumoListener::invalidate() {
  std::lock_guard lock(mutex_);
  if (!valid_) return;
  valid_ = false;
  if (fd_.valid()) LumoEventLoop::shared().remove(fd_.get());
  fd_.reset();
  if (!path_.empty()) unlink(path_.c_str());
}

void LumoListener::onReadable() {
  // A storm of connections must not hold the I/O thread from the connections it already serves:
  // a few accepts a turn, then the socket waits for the loop's next turn (it stays readable).
  for (int turn = 0; turn < kAcceptsPerTurn; ++turn) {
    if (!LumoAdmission::shared().mayAccept([weak = weak_from_this()] {
          if (auto self = weak.lock()) self->resumeListening();
        })) {
      // Too many peers owe their hello: the rest wait in the kernel until one answers, or until
      // the oldest silent one may be cut off.
      pauseListening();
      auto self = shared_from_this();
      queue_->asyncAfter(LumoAdmission::kHelloGrace, [self] { self->resumeListening(); });
      return;
    }
    if (!anonymous_) {
      int fd = accept4(fd_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
      if (fd < 0) {
        if (errno == EINTR || errno == ECONNABORTED) continue;
        if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
          backOff(std::strerror(errno));
          return;
        }
        if (errno != EAGAIN && errno != EWOULDBLOCK) {
          SystemLog("lumo error: %s - %@", "-[LumoListener accept]", std::strerror(errno));
        }
        return;
      }
      if (!offer(UniqueFd(fd))) return;
      continue;
    }
    // A connection request: one byte carrying one end of the requester's socket pair.
    char byte;
    iovec iov{&byte, 1};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * 4)];
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    ssize_t n = recvmsg(fd_.get(), &msg, MSG_CMSG_CLOEXEC | MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    std::vector<UniqueFd> received = n > 0 ? takeDescriptors(&msg) : std::vector<UniqueFd>{};
    if (n > 0 && (msg.msg_flags & MSG_CTRUNC) != 0 && received.empty()) {
      // Out of descriptors: the request is lost with its socket; its sender sees the end.
      backOff("out of descriptors");
      return;
    }
    if (n <= 0) return;
    // Exactly one socket per request; anything else is refused and closed.
    if (received.size() == 1 && !offer(std::move(received[0]))) return;
  }
}

void LumoListener::backOff(const std::string& why) {
  // Out of descriptors: the pending connections stay in the kernel's backlog. Stop watching the
  // socket for a moment instead of spinning on it, then try again.
  {
    std::lock_guard lock(mutex_);
    if (!backingOff_) {
      SystemLog("lumo error: %s - %@", "-[LumoListener accept]",
                "cannot accept (" + why + "); backing off");
    }
    backingOff_ = true;
  }
  pauseListening();
  auto self = shared_from_this();
  queue_->asyncAfter(kBackOff, [self] { self->resumeListening(); });
}

void LumoListener::pauseListening() {
  std::lock_guard lock(mutex_);
  if (!valid_ || !fd_.valid() || paused_) return;
  paused_ = true;
  LumoEventLoop::shared().remove(fd_.get());
}

void LumoListener::resumeListening() {
  std::lock_guard lock(mutex_);
  if (!valid_ || !fd_.valid() || !paused_) return;
  paused_ = false;
  auto self = shared_from_this();
  LumoEventLoop::shared().add(fd_.get(), EPOLLIN, [self](std::uint32_t) { self->onReadable(); });
}

bool LumoListener::offer(UniqueFd fd) {
  // The user's cap first, from the kernel's credentials alone: a peer over it costs no reading
  // of its process.
  ucred cred{};
  socklen_t length = sizeof cred;
  if (getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0) return true;
  if (!LumoAdmission::shared().admit(cred.uid)) return true;
  int error = 0;
  ProcessPin peer = ProcessPin::ofSocketPeer(fd.get(), &error);
  if (error == EMFILE || error == ENFILE) {
    LumoAdmission::shared().release(cred.uid);
    backOff(std::strerror(error));
    return false;
  }
  {
    std::lock_guard lock(mutex_);
    backingOff_ = false;
  }
  if (!peer.pinned() || peer.token().uid != cred.uid) {
    LumoAdmission::shared().release(cred.uid);
    return true;  // gone, or not identifiable: nothing may speak for it
  }
  const uid_t uid = peer.token().uid;
  auto connection = LumoConnection::adopt(std::move(fd), std::move(peer));
  LumoAdmission::shared().awaitHello(uid, connection);
  auto self = shared_from_this();
  queue_->async([self, connection] {
    std::shared_ptr<IpcListenerDelegate> delegate;
    {
      std::lock_guard lock(self->mutex_);
      delegate = self->delegate_.lock();
    }
    if (!delegate || !delegate->shouldAcceptNewConnection(*self, connection)) {
      connection->invalidate();
    }
  });
  return true;
}

}  // namespace typhora
