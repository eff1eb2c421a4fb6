// An in-process connection: the test delivers invocations to its exported object with the
// connection current, and invalidates it as the real IPC layer would.
#pragma once

#include <functional>
#include <mutex>
#include <optional>

#include "platform/ipc/ipc_connection.h"

namespace typhora::testing {

class FakeIpcConnection final : public IpcConnection {
 public:
  explicit FakeIpcConnection(AuditToken token = {}) : token_(token) {}

  void setExportedInterface(std::shared_ptr<const IpcInterface> interface) override;
  void setExportedObject(std::shared_ptr<IpcExportedObject> object) override;
  void setRemoteInterface(std::shared_ptr<const IpcInterface> interface) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void resume() override;
  void invalidate() override;
  bool isValid() const override;
  std::shared_ptr<IpcRemoteProxy> remoteObjectProxy(IpcErrorHandler errorHandler) override;
  std::shared_ptr<IpcRemoteProxy> synchronousRemoteObjectProxy(
      IpcErrorHandler errorHandler) override;
  AuditToken auditToken() const override { return token_; }

  // What an incoming message would do: refused (nullopt, with `error`) when the operation is
  // not exported, its arguments do not match, or the object does not implement it. Otherwise
  // the object runs on the calling thread with this connection current; the answer is the
  // reply's values, or nullopt in `replied` terms when the object has not replied (yet).
  struct Delivery {
    bool accepted = false;
    std::string error;
    std::optional<std::vector<Value>> reply;  // set once the reply closure ran
  };
  Delivery deliver(const std::string& wireName, std::vector<Value> arguments);

  // One-way calls made to the peer through remote proxies, in order.
  struct Sent {
    std::string wireName;
    std::vector<Value> arguments;
  };
  std::vector<Sent> sent() const;
  void recordSent(const std::string& wireName, std::vector<Value> arguments);

  bool resumed() const;
  std::shared_ptr<const IpcInterface> exportedInterface() const;
  std::shared_ptr<const IpcInterface> remoteInterface() const;
  std::shared_ptr<IpcExportedObject> exportedObject() const;

 private:
  mutable std::mutex mutex_;
  AuditToken token_;
  std::shared_ptr<const IpcInterface> exportedInterface_;
  std::shared_ptr<IpcExportedObject> exportedObject_;
  std::shared_ptr<const IpcInterface> remoteInterface_;
  std::function<void()> invalidationHandler_;
  std::function<void()> interruptionHandler_;
  std::vector<Sent> sent_;
  bool resumed_ = false;
  bool valid_ = true;
};

}  // namespace typhora::testing
