#include "platform/linux/lumo/lumo_admission.h"

#include <algorithm>

#include "platform/linux/lumo/lumo_connection.h"
#include "platform/log/log.h"

namespace typhora {

LumoAdmission& LumoAdmission::shared() {
  static auto* admission = new LumoAdmission();  // lives as long as the process
  return *admission;
}

void LumoAdmission::setLimits(const LumoAdmissionLimits& limits) {
  std::lock_guard lock(mutex_);
  limits_ = limits;
  outboundLimit_ = limits.outboundBytes;
}

LumoAdmissionLimits LumoAdmission::limits() const {
  std::lock_guard lock(mutex_);
  return limits_;
}

bool LumoAdmission::admit(uid_t uid) {
  {
    std::lock_guard lock(mutex_);
    std::size_t& count = connections_[uid];
    if (count < limits_.connectionsPerUser) {
      ++count;
      return true;
    }
  }
  logOnce("connections", uid,
          "user " + std::to_string(uid) + " holds too many connections; new ones are refused");
  return false;
}

void LumoAdmission::release(uid_t uid) {
  bool under = false;
  {
    std::lock_guard lock(mutex_);
    auto it = connections_.find(uid);
    if (it == connections_.end()) return;
    under = --it->second < limits_.connectionsPerUser;
    if (it->second == 0) connections_.erase(it);
  }
  if (under) clearLogged("connections", uid);
}

bool LumoAdmission::mayAccept(std::function<void()> retry) {
  std::shared_ptr<LumoConnection> victim;
  {
    std::lock_guard lock(mutex_);
    if (unidentifiedCount_ < limits_.unidentified) return true;
    victim = evictionVictimLocked();
    if (!victim) {
      retries_.push_back(std::move(retry));
      return false;
    }
  }
  logOnce("unidentified", victim->auditToken().uid,
          "too many connections without a hello; the oldest of the user holding most is cut off");
  victim->invalidate();
  return true;
}

void LumoAdmission::awaitHello(uid_t uid, const std::shared_ptr<LumoConnection>& connection) {
  std::lock_guard lock(mutex_);
  unidentified_[uid].push_back({connection.get(), connection, std::nullopt});
  ++unidentifiedCount_;
}

void LumoAdmission::helloSent(uid_t uid, const LumoConnection* connection) {
  std::lock_guard lock(mutex_);
  auto it = unidentified_.find(uid);
  if (it == unidentified_.end()) return;
  for (Waiting& waiting : it->second) {
    if (waiting.key == connection) waiting.since = std::chrono::steady_clock::now();
  }
}

std::shared_ptr<LumoConnection> LumoAdmission::evictionVictimLocked() {
  auto most = std::max_element(
      unidentified_.begin(), unidentified_.end(),
      [](const auto& a, const auto& b) { return a.second.size() < b.second.size(); });
  if (most == unidentified_.end() || most->second.empty()) return nullptr;
  if (most->second.size() * 4 < limits_.unidentified) return nullptr;
  // Honest peers answer the hello at once: only one silent past the grace since its hello went
  // out is cut off, never one still waiting for its hello.
  const auto now = std::chrono::steady_clock::now();
  auto silent = std::find_if(most->second.begin(), most->second.end(), [now](const Waiting& w) {
    return w.since && now - *w.since >= kHelloGrace;
  });
  if (silent == most->second.end()) return nullptr;
  Waiting oldest = std::move(*silent);
  most->second.erase(silent);
  --unidentifiedCount_;
  if (most->second.empty()) unidentified_.erase(most);
  return oldest.connection.lock();
}

void LumoAdmission::slotFreed() {
  std::vector<std::function<void()>> retries;
  {
    std::lock_guard lock(mutex_);
    retries.swap(retries_);
  }
  for (auto& retry : retries) retry();
}

void LumoAdmission::helloDone(uid_t uid, const LumoConnection* connection) {
  {
    std::lock_guard lock(mutex_);
    auto it = unidentified_.find(uid);
    if (it == unidentified_.end()) return;
    auto& waiting = it->second;
    auto entry = std::find_if(waiting.begin(), waiting.end(),
                              [connection](const Waiting& w) { return w.key == connection; });
    if (entry == waiting.end()) return;
    waiting.erase(entry);
    --unidentifiedCount_;
    if (waiting.empty()) unidentified_.erase(it);
    if (retries_.empty()) return;
  }
  slotFreed();
}

bool LumoAdmission::inboundOverLimit() const {
  const std::ptrdiff_t bytes = inbound_.load(std::memory_order_relaxed);
  std::lock_guard lock(mutex_);
  return bytes > static_cast<std::ptrdiff_t>(limits_.inboundBytes);
}

void LumoAdmission::logOnce(const char* kind, uid_t uid, const std::string& message) {
  {
    std::lock_guard lock(mutex_);
    // A peer going over a limit and back again and again (a user knocking at its cap, a storm
    // of connections after another) is logged once a while, not once a round.
    const auto now = std::chrono::steady_clock::now();
    auto [it, first] = logged_.try_emplace({kind, uid}, LoggedLimit{true, now});
    if (!first) {
      if (it->second.active || now - it->second.lastLine < kRelogInterval) return;
      it->second = {true, now};
    }
  }
  SystemLog("lumo error: %s - %@", "-[LumoAdmission]", message);
}

void LumoAdmission::clearLogged(const char* kind, uid_t uid) {
  std::lock_guard lock(mutex_);
  auto it = logged_.find({kind, uid});
  if (it != logged_.end()) it->second.active = false;
}

std::size_t LumoAdmission::connectionsOf(uid_t uid) const {
  std::lock_guard lock(mutex_);
  auto it = connections_.find(uid);
  return it == connections_.end() ? 0 : it->second;
}

std::size_t LumoAdmission::unidentifiedCount() const {
  std::lock_guard lock(mutex_);
  return unidentifiedCount_;
}

}  // namespace typhora
