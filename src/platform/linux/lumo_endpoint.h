// An anonymous listener's endpoint: a descriptor of the listener's private rendezvous socket.
// Whoever holds it can connect by sending one end of a new socket pair through it.
#pragma once

#include "platform/ipc_endpoint.h"
#include "platform/linux/unique_fd.h"

namespace typhora {

class LumoEndpoint final : public IpcEndpoint {
 public:
  explicit LumoEndpoint(UniqueFd fd) : fd_(std::move(fd)) {}
  int fd() const { return fd_.get(); }
  std::string description() const override {
    return "<lumo endpoint fd " + std::to_string(fd_.get()) + ">";
  }

 private:
  UniqueFd fd_;
};

}  // namespace typhora
