#include "ipc/local_notification_center.h"

#include <algorithm>

namespace typhora {

void LocalNotificationCenter::addObserver(const void* observer, const std::string& name,
                                          Callback callback) {
  std::lock_guard lock(mutex_);
  auto same = std::find_if(registrations_.begin(), registrations_.end(),
                           [&](const auto& r) { return r.observer == observer && r.name == name; });
  if (same != registrations_.end()) {
    same->callback = std::move(callback);
  } else {
    registrations_.push_back({observer, name, std::move(callback)});
  }
}

void LocalNotificationCenter::removeObserver(const void* observer) {
  std::lock_guard lock(mutex_);
  std::erase_if(registrations_, [observer](const auto& r) { return r.observer == observer; });
}

void LocalNotificationCenter::post(const std::string& name, const Value& userInfo) {
  std::vector<Callback> callbacks;
  {
    std::lock_guard lock(mutex_);
    for (const auto& r : registrations_)
      if (r.name == name) callbacks.push_back(r.callback);
  }
  for (const auto& callback : callbacks) callback(userInfo);
}

}  // namespace typhora
