#include "platform/linux/lumo/lumo_peer_log.h"

#include "platform/log/log.h"

namespace typhora {

LumoPeerLog& LumoPeerLog::shared() {
  static LumoPeerLog* log = new LumoPeerLog();  // lives as long as the process
  return *log;
}

void LumoPeerLog::error(uid_t uid, const char* where, const std::string& why) {
  std::size_t droppedBefore = 0;
  const bool admitted = admit(uid, &droppedBefore);
  if (droppedBefore > 0) {
    SystemLog("lumo error: %s - %@", "-[LumoConnection]",
              std::to_string(droppedBefore) + " more lines about peers of uid " +
                  std::to_string(uid) + " were not logged");
  }
  if (admitted) SystemLog("lumo error: %s - %@", where, why);
}

bool LumoPeerLog::admit(uid_t uid, std::size_t* droppedBefore) {
  std::lock_guard lock(mutex_);
  const Clock::time_point now = Clock::now();
  if (budgets_.size() >= kUsersKept && !budgets_.contains(uid)) {
    std::erase_if(budgets_, [&](const auto& entry) {
      return entry.second.dropped == 0 && now - entry.second.windowStart >= kWindow;
    });
  }
  Budget& budget = budgets_.try_emplace(uid, Budget{now}).first->second;
  if (now - budget.windowStart >= kWindow) {
    *droppedBefore = budget.dropped;
    budget = Budget{now};
  }
  if (budget.lines >= kLinesPerWindow) {
    ++budget.dropped;
    return false;
  }
  ++budget.lines;
  return true;
}

}  // namespace typhora
