// Presents controllers of view-service applications on screen at the daemon's request.
#pragma once

#include <memory>

#include "platform/services/remote_alert_handle.h"

namespace typhora {

class RemoteAlert {
 public:
  virtual ~RemoteAlert() = default;
  virtual std::unique_ptr<RemoteAlertHandle> makeHandle(RemoteAlertDefinition definition,
                                                        RemoteAlertConfiguration configuration) = 0;
};

}  // namespace typhora
