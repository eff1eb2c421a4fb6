// A one-way call sent unchanged to many connections. A one-way message carries no reply id, so
// every connection sends the same bytes: the IPC layer encodes it on its first send and every
// further connection queues that one encoding.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/ipc/ipc_interface.h"
#include "platform/value/value.h"

namespace typhora {

class IpcSharedMessage {
 public:
  using Encoding = std::shared_ptr<const std::vector<std::uint8_t>>;

  IpcSharedMessage(std::string wireName, std::vector<Value> arguments);
  IpcSharedMessage(const IpcSharedMessage&) = delete;
  IpcSharedMessage& operator=(const IpcSharedMessage&) = delete;

  const std::string& wireName() const { return wireName_; }
  const std::vector<Value>& arguments() const { return arguments_; }

  // The encoding for connections whose remote interface is `remote`, made by `encode` the first
  // time it is asked for (`encode` checks the arguments against that interface). Null when
  // `encode` could not make one: the caller then sends the message as any other call.
  Encoding encodingFor(const std::shared_ptr<const IpcInterface>& remote,
                       const std::function<Encoding()>& encode) const;

 private:
  struct Made {
    std::shared_ptr<const IpcInterface> remote;  // held, so its address names only it
    Encoding bytes;
  };

  const std::string wireName_;
  const std::vector<Value> arguments_;
  mutable std::mutex mutex_;  // connections of any thread may send it
  mutable std::vector<Made> made_;
};

}  // namespace typhora
