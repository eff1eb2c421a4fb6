// A build that is internal or not, as the test says; records the subsystems asked about.
#pragma once

#include <atomic>
#include <mutex>
#include <vector>

#include "platform/services/build_variant.h"

namespace typhora::testing {

class FakeBuildVariant final : public BuildVariant {
 public:
  void setInternal(bool internal) { internal_ = internal; }
  std::vector<std::string> askedSubsystems() const {
    std::lock_guard lock(mutex_);
    return asked_;
  }
  bool isInternalBuild(const std::string& subsystem) const override {
    std::lock_guard lock(mutex_);
    asked_.push_back(subsystem);
    return internal_;
  }

 private:
  std::atomic<bool> internal_{false};
  mutable std::mutex mutex_;
  mutable std::vector<std::string> asked_;
};

}  // namespace typhora::testing
