// Listeners and connections of the fake IPC: the test connects clients through the named
// listener's delegate, as the real service does when a process connects.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <mutex>

#include "platform/dispatch/semaphore.h"
#include "platform/ipc/ipc_listener.h"
#include "support/fake_ipc_connection.h"

namespace typhora::testing {

class FakeIpcListener;

// The endpoint of a fake anonymous listener: it leads the test to that listener.
class FakeIpcEndpoint final : public IpcEndpoint {
 public:
  explicit FakeIpcEndpoint(std::weak_ptr<FakeIpcListener> listener)
      : listener_(std::move(listener)) {}
  std::shared_ptr<FakeIpcListener> listener() const { return listener_.lock(); }
  std::string description() const override { return "<fake endpoint>"; }

 private:
  std::weak_ptr<FakeIpcListener> listener_;
};

class FakeIpcListener final : public IpcListener,
                              public std::enable_shared_from_this<FakeIpcListener> {
 public:
  void setDelegate(std::weak_ptr<IpcListenerDelegate> delegate) override;
  void resume() override;
  void invalidate() override;
  // An anonymous listener's endpoint; null for a named one.
  std::shared_ptr<const IpcEndpoint> endpoint() const override { return endpoint_; }
  void makeAnonymous() { endpoint_ = std::make_shared<FakeIpcEndpoint>(weak_from_this()); }

  bool resumed() const;
  // A new client connection offered to the delegate; null when refused or not resumed.
  std::shared_ptr<FakeIpcConnection> connect(AuditToken token = {});

 private:
  mutable std::mutex mutex_;
  std::weak_ptr<IpcListenerDelegate> delegate_;
  bool resumed_ = false;
  std::shared_ptr<const IpcEndpoint> endpoint_;
};

class FakeIpcService final : public IpcService {
 public:
  std::shared_ptr<IpcListener> makeNamedListener(const std::string& serviceName) override;
  std::shared_ptr<IpcListener> makeAnonymousListener() override;
  std::shared_ptr<IpcConnection> connect(std::shared_ptr<const IpcEndpoint> endpoint) override;
  std::shared_ptr<IpcConnection> connectToService(const std::string& serviceName) override;

  // The named listener made for `serviceName`, or null.
  std::shared_ptr<FakeIpcListener> listener(const std::string& serviceName) const;
  // Waits until a named listener for `serviceName` has been resumed.
  std::shared_ptr<FakeIpcListener> waitForListener(const std::string& serviceName);
  // Makes later anonymous listeners fail as they do when no socket pair can be made.
  void failAnonymousListeners() { failAnonymousListeners_ = true; }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, std::shared_ptr<FakeIpcListener>> listeners_;
  Semaphore listenerMade_;
  std::atomic<bool> failAnonymousListeners_{false};
};

}  // namespace typhora::testing
