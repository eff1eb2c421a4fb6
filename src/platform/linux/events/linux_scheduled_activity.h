// Background activities on Linux: each registered activity is checked in at once and then run
// every interval its launch configuration gives, on one queue (the main queue in the daemon).
// An activity with no interval runs only when asked to (runNow, from the event socket).
#pragma once

#include <map>
#include <mutex>

#include "platform/dispatch/clock.h"
#include "platform/dispatch/serial_queue.h"
#include "platform/linux/events/launch_configuration.h"
#include "platform/services/scheduled_activity.h"

namespace typhora {

class LinuxScheduledActivity final : public ScheduledActivity {
 public:
  LinuxScheduledActivity(const LaunchConfiguration& configuration, SerialQueue& queue)
      : configuration_(configuration), queue_(queue) {}

  void registerActivity(const std::string& identifier, Handler handler) override;
  // Runs a registered activity once more, now; false when none is registered by that name.
  bool runNow(const std::string& identifier);

 private:
  void scheduleNext(const std::string& identifier, Duration interval);

  const LaunchConfiguration& configuration_;
  SerialQueue& queue_;
  std::mutex mutex_;
  std::map<std::string, Handler> handlers_;
};

}  // namespace typhora
