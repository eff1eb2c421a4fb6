#include "platform/linux/lumo_listener.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/linux/lumo_connection.h"
#include "platform/linux/lumo_endpoint.h"
#include "platform/linux/lumo_event_loop.h"
#include "platform/linux/scm_rights.h"
#include "platform/log.h"

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
  for (;;) {
    if (!anonymous_) {
      int fd = accept4(fd_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
      if (fd < 0) {
        if (errno == EINTR || errno == ECONNABORTED) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) {
          SystemLog("lumo error: %s - %@", "-[LumoListener accept]", std::strerror(errno));
        }
        return;
      }
      offer(UniqueFd(fd));
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
    if (n <= 0) return;
    std::vector<UniqueFd> received = takeDescriptors(&msg);
    // Exactly one socket per request; anything else is refused and closed.
    if (received.size() == 1) offer(std::move(received[0]));
  }
}

void LumoListener::offer(UniqueFd fd) {
  auto connection = LumoConnection::adopt(std::move(fd));
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
}

}  // namespace typhora
