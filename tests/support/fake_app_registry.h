// Installed applications and their short versions, with a count of the questions asked.
#pragma once

#include <atomic>
#include <map>
#include <mutex>

#include "platform/services/app_registry.h"

namespace typhora::testing {

class FakeAppRegistry final : public AppRegistry {
 public:
  void setVersion(const std::string& identifier, std::optional<std::string> version) {
    std::lock_guard lock(mutex_);
    versions_[identifier] = std::move(version);
  }
  int queries() const { return queries_; }

  std::optional<std::string> shortVersionString(const std::string& identifier) const override {
    ++queries_;
    std::lock_guard lock(mutex_);
    auto it = versions_.find(identifier);
    return it == versions_.end() ? std::nullopt : it->second;
  }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, std::optional<std::string>> versions_;
  mutable std::atomic<int> queries_{0};
};

}  // namespace typhora::testing
