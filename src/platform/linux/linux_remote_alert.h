// Remote alerts on Linux: activating one starts the view service's program, as its
// configuration <root>/etc/typhora/view-services/<service name>.plist says:
//   {"Program": "<machine path>", "Arguments": ["..."]}
// The program gets the configured arguments, then "--controller <view controller class>"; the
// alert's endpoint as descriptor 3; and the user info as JSON on its standard input.
#pragma once

#include <string>

#include "platform/linux/device_root.h"
#include "platform/remote_alert.h"

namespace typhora {

class LinuxRemoteAlert final : public RemoteAlert {
 public:
  explicit LinuxRemoteAlert(std::string root) : root_(std::move(root)) {}
  std::unique_ptr<RemoteAlertHandle> makeHandle(RemoteAlertDefinition definition,
                                                RemoteAlertConfiguration configuration) override;

 private:
  DeviceRoot root_;
};

}  // namespace typhora
