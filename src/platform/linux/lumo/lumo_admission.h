// Process-wide bounds on what peers of this process's listeners may hold: connections per user,
// connections whose handshake has not finished, and inbound bytes buffered by all connections.
// Each bound is logged once per user until that user is back under it.
//
// Thread-safe; called from the I/O thread (accepts, reads) and from connection queues (ends).
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace typhora {

class LumoConnection;

struct LumoAdmissionLimits {
  std::size_t connectionsPerUser = 256;
  std::size_t unidentified = 64;  // accepted, handshake not finished
  std::size_t inboundBytes = 128u << 20;
  std::size_t descriptorsPerConnection = 64;
  // Answers queued for peers across connections; past it, peers that stopped reading are cut off.
  std::size_t outboundBytes = 256u << 20;
};

class LumoAdmission {
 public:
  static LumoAdmission& shared();

  void setLimits(const LumoAdmissionLimits& limits);
  LumoAdmissionLimits limits() const;

  // A connection from `uid` was accepted: false (logged once) when the user is at its cap.
  bool admit(uid_t uid);
  // The connection of `uid` ended.
  void release(uid_t uid);

  // Asked before each accept: true when a connection may be accepted now. At the cap of
  // unfinished handshakes, the oldest one of the user holding most of them is cut off if that
  // user holds at least a quarter of them and it has been silent for kHelloGrace (so one user
  // cannot hold every slot, while a burst of honest peers slowed by load is left alone);
  // otherwise the answer is false, and `retry` runs once a slot frees (the kernel's backlog holds
  // the rest meanwhile).
  bool mayAccept(std::function<void()> retry);
  static constexpr auto kHelloGrace = std::chrono::seconds(1);

  // `connection` was accepted and will owe its peer's hello: it counts against the cap at once,
  // so a burst accepted faster than the listener's delegate greets it is held to the cap too.
  void awaitHello(uid_t uid, const std::shared_ptr<LumoConnection>& connection);
  // The hello went out to `connection`'s peer: from now on its silence counts, and it may be cut
  // off once it has been silent for kHelloGrace.
  void helloSent(uid_t uid, const LumoConnection* connection);
  // The connection's handshake finished or it ended.
  void helloDone(uid_t uid, const LumoConnection* connection);

  // Inbound bytes buffered across connections.
  void addInbound(std::ptrdiff_t delta) { inbound_.fetch_add(delta, std::memory_order_relaxed); }
  bool inboundOverLimit() const;
  // Outbound bytes queued across connections, and whether `extra` more would pass the bound.
  void addOutbound(std::ptrdiff_t delta) { outbound_.fetch_add(delta, std::memory_order_relaxed); }
  bool outboundOverLimit(std::size_t extra) const {
    return outbound_.load(std::memory_order_relaxed) + static_cast<std::ptrdiff_t>(extra) >
           static_cast<std::ptrdiff_t>(outboundLimit_.load(std::memory_order_relaxed));
  }

  // Logs `message` for `uid` once, until clearLogged(kind, uid) and at most once a minute.
  void logOnce(const char* kind, uid_t uid, const std::string& message);
  void clearLogged(const char* kind, uid_t uid);

  std::size_t connectionsOf(uid_t uid) const;
  std::size_t unidentifiedCount() const;

 private:
  std::shared_ptr<LumoConnection> evictionVictimLocked();
  void slotFreed();

  mutable std::mutex mutex_;
  LumoAdmissionLimits limits_;
  std::map<uid_t, std::size_t> connections_;
  struct Waiting {
    const LumoConnection* key;
    std::weak_ptr<LumoConnection> connection;
    std::optional<std::chrono::steady_clock::time_point> since;  // the hello went out
  };
  std::vector<std::function<void()>> retries_;
  std::map<uid_t, std::deque<Waiting>> unidentified_;
  std::size_t unidentifiedCount_ = 0;
  struct LoggedLimit {
    bool active;  // over the limit since the last line
    std::chrono::steady_clock::time_point lastLine;
  };
  static constexpr auto kRelogInterval = std::chrono::seconds(60);
  std::map<std::pair<std::string, uid_t>, LoggedLimit> logged_;
  std::atomic<std::ptrdiff_t> inbound_{0};
  std::atomic<std::ptrdiff_t> outbound_{0};
  std::atomic<std::size_t> outboundLimit_{LumoAdmissionLimits{}.outboundBytes};  // read per send
};

}  // namespace typhora
