// The I/O loop of lumo: every socket of the process is watched by one epoll set, so an idle
// connection costs no thread. One thread at a time leads: it waits in epoll_wait and runs the
// handlers of what is ready, which must not block. A handler may give the leader one piece of
// work to run itself once the batch is handled (a connection's queue, with the frame it just
// read): the leader first passes the lead to a follower, so reading goes on while the work runs
// or blocks, and the message itself waits for no other thread's wake-up.
#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

namespace typhora {

class LumoEventLoop {
 public:
  using Handler = std::function<void(std::uint32_t events)>;
  using Work = std::function<void()>;

  static LumoEventLoop& shared();

  // Watches `fd` for `events` (EPOLLIN, EPOLLOUT...). Level-triggered.
  void add(int fd, std::uint32_t events, Handler handler);
  void modify(int fd, std::uint32_t events);
  // After this returns, no new call of the fd's handler starts.
  void remove(int fd);

  // From a handler: true when the calling thread leads a batch of one ready descriptor and may
  // still take work for after it (one piece a batch, while no other loop thread runs such work).
  bool canRunAfterHandoff() const;
  // Only after canRunAfterHandoff() answered true in the same handler: runs `work` on this thread
  // once the batch is handled and the lead has passed to another thread.
  void runAfterHandoff(Work work);

 private:
  LumoEventLoop();
  void threadMain();
  // Waits in epoll_wait and runs the handlers of one batch; answers the work a handler left.
  Work leadOneBatch();
  void handOffLocked();
  void startThreadLocked();

  int epoll_ = -1;
  std::mutex mutex_;
  struct Entry {
    std::uint32_t generation;
    std::shared_ptr<Handler> handler;
  };
  std::map<int, Entry> handlers_;
  std::uint32_t nextGeneration_ = 1;

  mutable std::mutex leadMutex_;
  std::condition_variable leadFree_;
  bool led_ = false;             // a thread leads (waits in epoll_wait or runs a batch)
  std::size_t followers_ = 0;    // threads waiting for the lead
  std::size_t runningWork_ = 0;  // threads running work left by a handler
};

}  // namespace typhora
