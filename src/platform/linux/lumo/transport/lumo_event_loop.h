// The one I/O thread of lumo: every socket of the process is watched by one epoll loop, so an
// idle connection costs no thread. Handlers run on the loop thread and must not block.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>

namespace typhora {

class LumoEventLoop {
 public:
  using Handler = std::function<void(std::uint32_t events)>;

  static LumoEventLoop& shared();

  // Watches `fd` for `events` (EPOLLIN, EPOLLOUT...). Level-triggered.
  void add(int fd, std::uint32_t events, Handler handler);
  void modify(int fd, std::uint32_t events);
  // After this returns, no new call of the fd's handler starts.
  void remove(int fd);
  bool onLoopThread() const { return std::this_thread::get_id() == thread_.get_id(); }

 private:
  LumoEventLoop();
  void loop();

  int epoll_ = -1;
  std::mutex mutex_;
  struct Entry {
    std::uint32_t generation;
    std::shared_ptr<Handler> handler;
  };
  std::map<int, Entry> handlers_;
  std::uint32_t nextGeneration_ = 1;
  std::thread thread_;
};

}  // namespace typhora
