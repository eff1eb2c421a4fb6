// One controller of a view service, presented by starting the service's configured program:
//
//   <Program> <Arguments...> --controller <view controller class name>
//
// with the configuration's endpoint as descriptor 3 and the user info as JSON on standard input.
// Each activation starts the program anew. A failure to start it is logged and reported as the
// end of the view service at once; otherwise its exit is, when the process is reaped.
#pragma once

#include <string>

#include "platform/services/remote_alert_handle.h"

namespace typhora {

class LinuxRemoteAlertHandle final : public RemoteAlertHandle {
 public:
  LinuxRemoteAlertHandle(std::string deviceRoot, RemoteAlertDefinition definition,
                         RemoteAlertConfiguration configuration);
  void activate(const Value& userInfo, EndedHandler ended) override;

 private:
  bool present(const Value& userInfo, EndedHandler ended, std::string* error) const;

  std::string deviceRoot_;
  RemoteAlertDefinition definition_;
  RemoteAlertConfiguration configuration_;
};

}  // namespace typhora
