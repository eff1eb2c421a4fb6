#include "platform/linux/events/linux_scheduled_activity.h"

#include <chrono>

namespace typhora {

void LinuxScheduledActivity::registerActivity(const std::string& identifier, Handler handler) {
  {
    std::lock_guard lock(mutex_);
    handlers_[identifier] = handler;
  }
  queue_.async([handler] { handler(ScheduledActivityState::checkIn); });
  if (std::optional<double> seconds = configuration_.activityInterval(identifier)) {
    scheduleNext(identifier,
                 std::chrono::duration_cast<Duration>(std::chrono::duration<double>(*seconds)));
  }
}

void LinuxScheduledActivity::scheduleNext(const std::string& identifier, Duration interval) {
  // The activity lives as long as the process, like the platform that runs it.
  queue_.asyncAfter(interval, [this, identifier, interval] {
    Handler handler;
    {
      std::lock_guard lock(mutex_);
      handler = handlers_[identifier];
    }
    handler(ScheduledActivityState::run);
    scheduleNext(identifier, interval);
  });
}

bool LinuxScheduledActivity::runNow(const std::string& identifier) {
  Handler handler;
  {
    std::lock_guard lock(mutex_);
    auto it = handlers_.find(identifier);
    if (it == handlers_.end()) return false;
    handler = it->second;
  }
  queue_.async([handler] { handler(ScheduledActivityState::run); });
  return true;
}

}  // namespace typhora
