// One controller of a view service, presented by starting the service's configured program:
//
//   <Program> <Arguments...> --controller <view controller class name>
//
// with the configuration's endpoint as descriptor 3 and the user info as JSON on standard input.
// Each activation starts the program anew. Failures are logged; presenting reports no outcome.
#pragma once

#include <string>

#include "platform/remote_alert_handle.h"

namespace typhora {

class LinuxRemoteAlertHandle final : public RemoteAlertHandle {
 public:
  LinuxRemoteAlertHandle(std::string deviceRoot, RemoteAlertDefinition definition,
                         RemoteAlertConfiguration configuration);
  void activate(const Value& userInfo) override;

 private:
  bool present(const Value& userInfo, std::string* error) const;

  std::string deviceRoot_;
  RemoteAlertDefinition definition_;
  RemoteAlertConfiguration configuration_;
};

}  // namespace typhora
