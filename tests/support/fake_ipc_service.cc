#include "support/fake_ipc_service.h"

namespace typhora::testing {

void FakeIpcListener::setDelegate(std::weak_ptr<IpcListenerDelegate> delegate) {
  std::lock_guard lock(mutex_);
  delegate_ = std::move(delegate);
}

void FakeIpcListener::resume() {
  std::lock_guard lock(mutex_);
  resumed_ = true;
}

void FakeIpcListener::invalidate() {
  std::lock_guard lock(mutex_);
  resumed_ = false;
}

bool FakeIpcListener::resumed() const {
  std::lock_guard lock(mutex_);
  return resumed_;
}

std::shared_ptr<FakeIpcConnection> FakeIpcListener::connect(AuditToken token) {
  std::shared_ptr<IpcListenerDelegate> delegate;
  {
    std::lock_guard lock(mutex_);
    if (!resumed_) return nullptr;
    delegate = delegate_.lock();
  }
  if (!delegate) return nullptr;
  auto connection = std::make_shared<FakeIpcConnection>(token);
  if (!delegate->shouldAcceptNewConnection(*this, connection)) return nullptr;
  return connection;
}

std::shared_ptr<IpcListener> FakeIpcService::makeNamedListener(const std::string& serviceName) {
  auto listener = std::make_shared<FakeIpcListener>();
  {
    std::lock_guard lock(mutex_);
    listeners_[serviceName] = listener;
  }
  listenerMade_.signal();
  return listener;
}

std::shared_ptr<IpcListener> FakeIpcService::makeAnonymousListener() {
  if (failAnonymousListeners_) return nullptr;
  auto listener = std::make_shared<FakeIpcListener>();
  listener->makeAnonymous();
  return listener;
}

std::shared_ptr<IpcConnection> FakeIpcService::connect(std::shared_ptr<const IpcEndpoint>) {
  return std::make_shared<FakeIpcConnection>();
}

std::shared_ptr<IpcConnection> FakeIpcService::connectToService(const std::string&) {
  return std::make_shared<FakeIpcConnection>();
}

std::shared_ptr<FakeIpcListener> FakeIpcService::listener(const std::string& serviceName) const {
  std::lock_guard lock(mutex_);
  auto it = listeners_.find(serviceName);
  return it == listeners_.end() ? nullptr : it->second;
}

std::shared_ptr<FakeIpcListener> FakeIpcService::waitForListener(const std::string& serviceName) {
  for (;;) {
    if (auto found = listener(serviceName); found && found->resumed()) return found;
    listenerMade_.waitFor(std::chrono::milliseconds(5));
  }
}

}  // namespace typhora::testing
