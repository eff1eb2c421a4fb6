// The daemon's in-process publish-and-subscribe hub. A post calls every observer of its name
// synchronously, on the posting thread, before it returns. An observer registers at most once
// per name: registering again replaces the callback, so a client that checks in twice is told
// of each change once.
#pragma once

#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

class LocalNotificationCenter {
 public:
  using Callback = std::function<void(const Value& userInfo)>;

  void addObserver(const void* observer, const std::string& name, Callback callback);
  // Removes every registration of `observer`.
  void removeObserver(const void* observer);
  void post(const std::string& name, const Value& userInfo);

 private:
  struct Registration {
    const void* observer;
    std::string name;
    Callback callback;
  };
  std::mutex mutex_;  // the list only: callbacks run outside it, so they may register or post
  std::vector<Registration> registrations_;
};

}  // namespace typhora
