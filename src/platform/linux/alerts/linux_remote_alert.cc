#include "platform/linux/alerts/linux_remote_alert.h"

#include "platform/linux/alerts/linux_remote_alert_handle.h"

namespace typhora {

LinuxRemoteAlert::LinuxRemoteAlert(std::string deviceRoot) : deviceRoot_(std::move(deviceRoot)) {}

std::unique_ptr<RemoteAlertHandle> LinuxRemoteAlert::makeHandle(
    RemoteAlertDefinition definition, RemoteAlertConfiguration configuration) {
  return std::make_unique<LinuxRemoteAlertHandle>(deviceRoot_, std::move(definition),
                                                  std::move(configuration));
}

}  // namespace typhora
