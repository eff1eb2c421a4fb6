// The launch event streams on Linux: notifications posted on the event socket (or by the daemon
// through SystemNotify) reach the stream's handler when the launch configuration lists their
// name. Events that arrive before the handler is installed wait for it, in order and up to a
// bound: the daemon may have been started by the very event its handler is about to want.
#pragma once

#include <deque>
#include <map>
#include <mutex>

#include "platform/linux/events/launch_configuration.h"
#include "platform/services/launch_event_stream.h"

namespace typhora {

class LinuxLaunchEventStream final : public LaunchEventStream {
 public:
  static constexpr std::size_t kMaxWaitingEvents = 1000;

  explicit LinuxLaunchEventStream(const LaunchConfiguration& configuration)
      : configuration_(configuration) {}

  void setEventHandler(LaunchEventStreamKind kind, SerialQueue& queue, Handler handler) override;
  // Hands a posted notification to stream `kind`; false when the configuration does not
  // deliver that name on it, or too many events already wait for a handler.
  bool deliver(LaunchEventStreamKind kind, const std::string& name, const Value& userInfo);

 private:
  struct Stream {
    SerialQueue* queue = nullptr;
    Handler handler;
    std::deque<Value> waiting;
  };

  const LaunchConfiguration& configuration_;
  std::mutex mutex_;  // also keeps each stream's events in posting order on its queue
  std::map<LaunchEventStreamKind, Stream> streams_;
};

}  // namespace typhora
