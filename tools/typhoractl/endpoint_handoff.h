// Hands a lumo endpoint from one typhoractl process to another over a socket pair: the way a
// web-content process gives its application the endpoint the daemon is to connect to.
#pragma once

#include <memory>
#include <string>

#include "platform/linux/lumo/lumo_endpoint.h"

namespace typhora::ctl {

class EndpointHandoff {
 public:
  static bool send(int socket, const IpcEndpoint& endpoint, std::string* error);
  // Waits for one endpoint on `socket`; null with `error` set when none came.
  static std::shared_ptr<const LumoEndpoint> receive(int socket, std::string* error);
};

}  // namespace typhora::ctl
