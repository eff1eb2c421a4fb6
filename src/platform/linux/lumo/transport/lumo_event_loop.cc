#include "platform/linux/lumo/transport/lumo_event_loop.h"

#include <sys/epoll.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace typhora {

LumoEventLoop& LumoEventLoop::shared() {
  static auto* loop = new LumoEventLoop();  // lives as long as the process
  return *loop;
}

LumoEventLoop::LumoEventLoop() : epoll_(epoll_create1(EPOLL_CLOEXEC)) {
  if (epoll_ < 0) {
    std::perror("lumo: epoll_create1");
    std::abort();
  }
  thread_ = std::thread([this] { loop(); });
}

void LumoEventLoop::add(int fd, std::uint32_t events, Handler handler) {
  std::lock_guard lock(mutex_);
  const std::uint32_t generation = nextGeneration_++;
  handlers_[fd] = {generation, std::make_shared<Handler>(std::move(handler))};
  epoll_event event{};
  event.events = events;
  event.data.u64 = (static_cast<std::uint64_t>(generation) << 32) | static_cast<std::uint32_t>(fd);
  epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &event);
}

void LumoEventLoop::modify(int fd, std::uint32_t events) {
  std::lock_guard lock(mutex_);
  auto it = handlers_.find(fd);
  if (it == handlers_.end()) return;
  epoll_event event{};
  event.events = events;
  event.data.u64 =
      (static_cast<std::uint64_t>(it->second.generation) << 32) | static_cast<std::uint32_t>(fd);
  epoll_ctl(epoll_, EPOLL_CTL_MOD, fd, &event);
}

void LumoEventLoop::remove(int fd) {
  std::lock_guard lock(mutex_);
  if (handlers_.erase(fd) > 0) epoll_ctl(epoll_, EPOLL_CTL_DEL, fd, nullptr);
}

void LumoEventLoop::loop() {
  epoll_event events[64];
  for (;;) {
    int n = epoll_wait(epoll_, events, 64, -1);
    if (n < 0) {
      if (errno == EINTR) continue;
      std::perror("lumo: epoll_wait");
      std::abort();
    }
    for (int i = 0; i < n; ++i) {
      const int fd = static_cast<int>(events[i].data.u64 & 0xffffffffu);
      const auto generation = static_cast<std::uint32_t>(events[i].data.u64 >> 32);
      std::shared_ptr<Handler> handler;
      {
        std::lock_guard lock(mutex_);
        auto it = handlers_.find(fd);
        // A stale event of a descriptor removed (and maybe reused) since: ignore it.
        if (it == handlers_.end() || it->second.generation != generation) continue;
        handler = it->second.handler;
      }
      (*handler)(events[i].events);
    }
  }
}

}  // namespace typhora
