// What the platform is asked to present: a controller of a view service, the endpoint on which
// the presented controller talks back, and the user info handed to it on activation.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/ipc/ipc_endpoint.h"
#include "platform/value/value.h"

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
  // Runs once, on any thread, when the presented view service could not be started or has
  // ended: after that, nothing more can come from it over the endpoint that it had not already
  // sent.
  using EndedHandler = std::function<void()>;

  // Presents the controller with `userInfo` (a dictionary). The view service answers, if at all,
  // over the configuration's endpoint; `ended` (may be empty) tells when it no longer can.
  virtual void activate(const Value& userInfo, EndedHandler ended) = 0;
};

}  // namespace typhora
