// What the platform is asked to present: a controller of a view service, the endpoint on which
// the presented controller talks back, and the user info handed to it on activation.
#pragma once

#include <memory>
#include <string>

#include "platform/ipc_endpoint.h"
#include "platform/value.h"

namespace typhora {

struct RemoteAlertDefinition {
  std::string serviceName;
  std::string viewControllerClassName;
};

struct RemoteAlertConfiguration {
  std::shared_ptr<const IpcEndpoint> endpoint;
};

class RemoteAlertHandle {
 public:
  virtual ~RemoteAlertHandle() = default;
  // Presents the controller with `userInfo` (a dictionary). Presenting reports no outcome; the
  // view service answers, if at all, over the configuration's endpoint.
  virtual void activate(const Value& userInfo) = 0;
};

}  // namespace typhora
