// The launch event streams: named notifications that the platform delivers to the daemon, and
// for which it starts the daemon when it is not running. Which names a stream carries is set in
// the daemon's launch configuration.
#pragma once

#include <functional>

#include "platform/dispatch/serial_queue.h"
#include "platform/value/value.h"

namespace typhora {

enum class LaunchEventStreamKind {
  distributedNotification,  // notifications with a user info, posted by platform components
  systemNotification,       // bare names, posted system-wide
};

// An event is a dictionary: the notification's name under kLaunchEventNameKey and, for a
// distributed notification, its user info under kLaunchEventUserInfoKey.
inline constexpr const char* kLaunchEventNameKey = "Name";
inline constexpr const char* kLaunchEventUserInfoKey = "UserInfo";

class LaunchEventStream {
 public:
  using Handler = std::function<void(const Value& event)>;
  virtual ~LaunchEventStream() = default;
  // Installs the one handler of stream `kind`; it runs on `queue`, one event at a time.
  virtual void setEventHandler(LaunchEventStreamKind kind, SerialQueue& queue, Handler handler) = 0;
};

}  // namespace typhora
