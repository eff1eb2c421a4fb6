// What peers get wrong, in the system log without letting them write it. Each connection logs its
// own refusal once, but a peer that opens connection after connection (tens of thousands a
// minute) would otherwise fill the journal and spend the daemon's time on it: the lines about one
// user's peers are kept to a budget per window, and what went over is counted in one line when
// the next window opens.
//
// Thread-safe: the I/O thread (reads) and connection queues (decoding, dispatch, sends) log.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <map>
#include <mutex>
#include <string>

namespace typhora {

class LumoPeerLog {
 public:
  static constexpr std::size_t kLinesPerWindow = 32;
  static constexpr auto kWindow = std::chrono::seconds(10);

  // The process's log of peers.
  static LumoPeerLog& shared();

  // Logs "lumo error: <where> - <why>" for a peer of user `uid`, unless that user's peers have
  // used their budget in this window.
  void error(uid_t uid, const char* where, const std::string& why);

 private:
  using Clock = std::chrono::steady_clock;
  struct Budget {
    Clock::time_point windowStart;
    std::size_t lines = 0;
    std::size_t dropped = 0;
  };
  // Users seen; a budget is forgotten once its window passed with nothing dropped.
  static constexpr std::size_t kUsersKept = 1024;

  bool admit(uid_t uid, std::size_t* droppedBefore);

  std::mutex mutex_;
  std::map<uid_t, Budget> budgets_;
};

}  // namespace typhora
