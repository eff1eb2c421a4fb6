// Registered activities, run when a test says so.
#pragma once

#include <map>
#include <mutex>

#include "platform/services/scheduled_activity.h"

namespace typhora::testing {

class FakeScheduledActivity final : public ScheduledActivity {
 public:
  // Registration records the handler; the test makes the check-in and run calls.
  void registerActivity(const std::string& identifier, Handler handler) override {
    std::lock_guard lock(mutex_);
    handlers_[identifier] = std::move(handler);
  }
  bool isRegistered(const std::string& identifier) const {
    std::lock_guard lock(mutex_);
    return handlers_.contains(identifier);
  }
  // Calls the handler of `identifier` on this thread; false when it is not registered.
  bool call(const std::string& identifier, ScheduledActivityState state) {
    Handler handler;
    {
      std::lock_guard lock(mutex_);
      auto it = handlers_.find(identifier);
      if (it == handlers_.end()) return false;
      handler = it->second;
    }
    handler(state);
    return true;
  }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, Handler> handlers_;
};

}  // namespace typhora::testing
