#include "raw_socket_peer.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

namespace typhora::bench {
namespace {

using Clock = std::chrono::steady_clock;

bool writeAll(int fd, const char* data, std::size_t size) {
  while (size > 0) {
    const ssize_t n = send(fd, data, size, MSG_NOSIGNAL);
    if (n <= 0) return false;
    data += n;
    size -= static_cast<std::size_t>(n);
  }
  return true;
}

bool readAll(int fd, char* data, std::size_t size) {
  return recv(fd, data, size, MSG_WAITALL) == static_cast<ssize_t>(size);
}

}  // namespace

double rawRoundTrip(std::size_t bytes, int rounds) {
  return rawTransfer(bytes, bytes, rounds);
}

double rawTransfer(std::size_t requestBytes, std::size_t replyBytes, int rounds) {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0) return 0;
  std::thread server([fd = pair[1], requestBytes, replyBytes, rounds] {
    std::vector<char> request(requestBytes);
    std::vector<char> reply(replyBytes, 'r');
    for (int i = 0; i < rounds; ++i) {
      if (!readAll(fd, request.data(), requestBytes)) break;
      if (!writeAll(fd, reply.data(), replyBytes)) break;
    }
  });
  std::vector<char> request(requestBytes, 'q');
  std::vector<char> reply(replyBytes);
  const auto start = Clock::now();
  for (int i = 0; i < rounds; ++i) {
    writeAll(pair[0], request.data(), requestBytes);
    readAll(pair[0], reply.data(), replyBytes);
  }
  const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  server.join();
  close(pair[0]);
  close(pair[1]);
  return seconds / rounds;
}

double rawFanout(int sockets, int readers, std::size_t bytes) {
  std::vector<int> writers, ends;
  for (int i = 0; i < sockets; ++i) {
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0) break;
    writers.push_back(pair[0]);
    ends.push_back(pair[1]);
  }
  std::atomic<std::int64_t> lastRead{0};
  std::vector<std::thread> threads;
  for (int r = 0; r < readers; ++r) {
    threads.emplace_back([&, r] {
      const int poll = epoll_create1(0);
      std::vector<std::size_t> left;
      std::size_t pending = 0;
      for (std::size_t i = static_cast<std::size_t>(r); i < ends.size();
           i += static_cast<std::size_t>(readers)) {
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.u64 = (i << 20) | left.size();
        epoll_ctl(poll, EPOLL_CTL_ADD, ends[i], &event);
        left.push_back(bytes);
        ++pending;
      }
      std::vector<char> buffer(bytes);
      epoll_event events[64];
      while (pending > 0) {
        const int n = epoll_wait(poll, events, 64, 5000);
        if (n <= 0) break;
        for (int k = 0; k < n; ++k) {
          const std::size_t socket = events[k].data.u64 >> 20;
          std::size_t& remaining = left[events[k].data.u64 & 0xfffff];
          const ssize_t got = recv(ends[socket], buffer.data(), remaining, MSG_DONTWAIT);
          if (got <= 0) continue;
          remaining -= static_cast<std::size_t>(got);
          if (remaining == 0) --pending;
        }
      }
      close(poll);
      const std::int64_t now = Clock::now().time_since_epoch().count();
      std::int64_t seen = lastRead.load();
      while (now > seen && !lastRead.compare_exchange_weak(seen, now)) {
      }
    });
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(20));  // readers are waiting
  std::vector<char> message(bytes, 'm');
  const auto start = Clock::now();
  for (int fd : writers) writeAll(fd, message.data(), bytes);
  for (auto& thread : threads) thread.join();
  for (int fd : writers) close(fd);
  for (int fd : ends) close(fd);
  const Clock::time_point end{Clock::duration(lastRead.load())};
  return std::chrono::duration<double>(end - start).count();
}

}  // namespace typhora::bench
