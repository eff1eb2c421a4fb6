// The daemon's launch configuration from arbitrary file bytes, queried as the daemon does.
#include <cmath>
#include <cstdint>

#include "platform/linux/events/launch_configuration.h"
#include "platform/value/plist_reader.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::optional<typhora::Value> plist = typhora::PlistReader::read({data, size});
  if (!plist) return 0;
  const typhora::LaunchConfiguration configuration(*plist);
  configuration.delivers(typhora::LaunchEventStreamKind::distributedNotification,
                         "com.zorvane.Apploom.applicationUnregistered");
  configuration.delivers(typhora::LaunchEventStreamKind::systemNotification, "");
  if (auto interval = configuration.activityInterval("com.zorvane.typhorad.check-asset-update")) {
    // A schedule the timers could not keep is no schedule.
    if (!std::isfinite(*interval) || *interval <= 0) __builtin_trap();
  }
  return 0;
}
