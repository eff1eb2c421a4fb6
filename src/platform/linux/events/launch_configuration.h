// The daemon's launch configuration, <root>/etc/typhora/typhorad.launch.plist (JSON or CBOR):
//
//   {
//     "LaunchEvents": {
//       "distributedNotification": ["com.zorvane.Apploom.applicationUnregistered"],
//       "systemNotification": ["..."]
//     },
//     "Activities": { "<activity identifier>": { "Interval": <seconds> } }
//   }
//
// It says which notifications reach the daemon on each launch event stream and how often its
// background activities run. It is read once, when the daemon starts; a missing or malformed
// file means no events and no schedules.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>

#include "platform/services/launch_event_stream.h"
#include "platform/value/value.h"

namespace typhora {

class LaunchConfiguration {
 public:
  explicit LaunchConfiguration(const std::string& root);
  // The configuration in `plist`; entries of the wrong type are left out.
  explicit LaunchConfiguration(const Value& plist);

  bool delivers(LaunchEventStreamKind kind, const std::string& name) const;
  // The interval of activity `identifier` in seconds, when it is scheduled.
  std::optional<double> activityInterval(const std::string& identifier) const;

 private:
  void load(const Value& plist);

  std::set<std::string> distributedNames_;
  std::set<std::string> systemNames_;
  std::map<std::string, double> intervals_;
};

}  // namespace typhora
