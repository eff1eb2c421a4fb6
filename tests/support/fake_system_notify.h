// Records the names posted.
#pragma once

#include <mutex>
#include <vector>

#include "platform/services/system_notify.h"

namespace typhora::testing {

class FakeSystemNotify final : public SystemNotify {
 public:
  void post(const std::string& name) override {
    std::lock_guard lock(mutex_);
    posted_.push_back(name);
  }
  std::vector<std::string> posted() const {
    std::lock_guard lock(mutex_);
    return posted_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> posted_;
};

}  // namespace typhora::testing
