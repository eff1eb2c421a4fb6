// An endpoint of an anonymous listener: a capability that can travel inside IPC messages to any
// process, which can then connect to the listener. Nobody without one can.
#pragma once

#include <string>

namespace typhora {

class IpcEndpoint {
 public:
  virtual ~IpcEndpoint() = default;
  virtual std::string description() const = 0;
};

}  // namespace typhora
