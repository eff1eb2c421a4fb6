// Remote alerts on Linux: presenting a controller starts the view service's configured program
// (see ViewServiceConfiguration) with the endpoint and the user info.
#pragma once

#include <string>

#include "platform/services/remote_alert.h"

namespace typhora {

class LinuxRemoteAlert final : public RemoteAlert {
 public:
  explicit LinuxRemoteAlert(std::string deviceRoot);
  std::unique_ptr<RemoteAlertHandle> makeHandle(RemoteAlertDefinition definition,
                                                RemoteAlertConfiguration configuration) override;

 private:
  std::string deviceRoot_;
};

}  // namespace typhora
