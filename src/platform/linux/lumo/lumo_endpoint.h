// An anonymous listener's endpoint: a descriptor of the listener's private rendezvous socket.
// Whoever holds it can connect by sending one end of a new socket pair through it.
#pragma once

#include <memory>
#include <string>

#include "platform/fd/unique_fd.h"
#include "platform/ipc/ipc_endpoint.h"

namespace typhora {

class LumoEndpoint final : public IpcEndpoint {
 public:
  explicit LumoEndpoint(UniqueFd fd) : fd_(std::move(fd)) {}
  // Takes over descriptor `fd`, inherited from the process that started this one (which passed
  // its endpoint that way). Null with `error` set when `fd` is not a socket.
  static std::shared_ptr<const LumoEndpoint> inherited(int fd, std::string* error);
  int fd() const { return fd_.get(); }
  std::string description() const override {
    return "<lumo endpoint fd " + std::to_string(fd_.get()) + ">";
  }

 private:
  UniqueFd fd_;
};

}  // namespace typhora
