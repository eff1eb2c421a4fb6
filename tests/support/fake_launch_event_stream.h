// Launch event streams whose events a test posts.
#pragma once

#include <map>
#include <mutex>

#include "platform/services/launch_event_stream.h"

namespace typhora::testing {

class FakeLaunchEventStream final : public LaunchEventStream {
 public:
  void setEventHandler(LaunchEventStreamKind kind, SerialQueue& queue, Handler handler) override {
    std::lock_guard lock(mutex_);
    handlers_[kind] = {&queue, std::move(handler)};
  }
  bool hasHandler(LaunchEventStreamKind kind) const {
    std::lock_guard lock(mutex_);
    return handlers_.contains(kind);
  }
  // Queues `event` to the stream's handler; false when none is installed.
  bool post(LaunchEventStreamKind kind, Value event) {
    std::lock_guard lock(mutex_);
    auto it = handlers_.find(kind);
    if (it == handlers_.end()) return false;
    it->second.queue->async([handler = it->second.handler, event] { handler(event); });
    return true;
  }

 private:
  struct Installed {
    SerialQueue* queue;
    Handler handler;
  };
  mutable std::mutex mutex_;
  std::map<LaunchEventStreamKind, Installed> handlers_;
};

}  // namespace typhora::testing
