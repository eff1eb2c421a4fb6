// Records the events sent. While the sink does not want events, builders are not called.
#pragma once

#include <atomic>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/services/analytics_sink.h"

namespace typhora::testing {

class FakeAnalyticsSink final : public AnalyticsSink {
 public:
  void setWantsEvents(bool wants) { wants_ = wants; }
  std::vector<std::pair<std::string, Value>> events() const {
    std::lock_guard lock(mutex_);
    return events_;
  }

  void sendEvent(const std::string& name, const Builder& builder) override {
    if (!wants_) return;
    Value event = builder();
    std::lock_guard lock(mutex_);
    events_.emplace_back(name, std::move(event));
  }

 private:
  std::atomic<bool> wants_{true};
  mutable std::mutex mutex_;
  std::vector<std::pair<std::string, Value>> events_;
};

}  // namespace typhora::testing
