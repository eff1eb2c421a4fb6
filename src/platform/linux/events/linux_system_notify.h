// System-wide notifications on Linux: posted through the event hub, to every watcher and to the
// daemon's own system-notification stream.
#pragma once

#include "platform/linux/events/linux_event_hub.h"
#include "platform/services/system_notify.h"

namespace typhora {

class LinuxSystemNotify final : public SystemNotify {
 public:
  explicit LinuxSystemNotify(LinuxEventHub& hub) : hub_(hub) {}
  void post(const std::string& name) override {
    hub_.post(LaunchEventStreamKind::systemNotification, name, Value());
  }

 private:
  LinuxEventHub& hub_;
};

}  // namespace typhora
