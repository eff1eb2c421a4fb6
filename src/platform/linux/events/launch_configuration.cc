#include "platform/linux/events/launch_configuration.h"

#include "platform/linux/files/device_root.h"
#include "platform/log/log.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace {

constexpr const char* kFile = "/etc/typhora/typhorad.launch.plist";

std::set<std::string> namesIn(const Value& list) {
  std::set<std::string> names;
  if (const ValueArray* items = list.asArray()) {
    for (const Value& item : *items)
      if (const std::string* name = item.asString()) names.insert(*name);
  }
  return names;
}

}  // namespace

LaunchConfiguration::LaunchConfiguration(const std::string& root) {
  const std::string path = DeviceRoot(root).onDisk(kFile);
  std::string error;
  std::optional<Value> plist = PlistReader::readFile(path, {}, &error);
  if (!plist) {
    TYLog_Error(kTYLogTyphoraDaemon, "launch configuration %@: %@", path, error);
    return;
  }
  load(*plist);
}

LaunchConfiguration::LaunchConfiguration(const Value& plist) {
  load(plist);
}

void LaunchConfiguration::load(const Value& plist) {
  const Value& events = plist.get("LaunchEvents");
  distributedNames_ = namesIn(events.get("distributedNotification"));
  systemNames_ = namesIn(events.get("systemNotification"));
  if (const Dictionary* activities = plist.get("Activities").asDictionary()) {
    for (const auto& [identifier, settings] : activities->entries()) {
      std::optional<double> interval = settings.get("Interval").asDouble();
      if (interval && *interval > 0) intervals_[identifier] = *interval;
    }
  }
}

bool LaunchConfiguration::delivers(LaunchEventStreamKind kind, const std::string& name) const {
  const auto& names =
      kind == LaunchEventStreamKind::distributedNotification ? distributedNames_ : systemNames_;
  return names.contains(name);
}

std::optional<double> LaunchConfiguration::activityInterval(const std::string& identifier) const {
  auto it = intervals_.find(identifier);
  return it == intervals_.end() ? std::nullopt : std::optional(it->second);
}

}  // namespace typhora
