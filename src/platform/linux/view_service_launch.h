// One activation of a view service: its program started with the alert's endpoint and user
// info. A thread of its own feeds the user info to the program and reaps it, so the caller never
// waits on the program and no zombie is left; alerts are rare, so a thread each is cheap enough.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/ipc_endpoint.h"
#include "platform/value.h"

namespace typhora {

class ViewServiceLaunch {
 public:
  // Starts `program` with `arguments`; false (logged) when it could not be started.
  static bool start(const std::string& program, const std::vector<std::string>& arguments,
                    const std::shared_ptr<const IpcEndpoint>& endpoint, const Value& userInfo);
};

}  // namespace typhora
