#include "support/fake_ipc_connection.h"

namespace typhora::testing {
namespace {

// Calls through the fake reach nobody: they fail at once, as calls to a gone peer do.
class UnreachableProxy final : public IpcRemoteProxy {
 public:
  explicit UnreachableProxy(IpcErrorHandler handler) : handler_(std::move(handler)) {}
  void call(const std::string& wireName, std::vector<Value>, IpcReply) override {
    if (handler_) handler_("no peer answers " + wireName + " on a fake connection");
  }

 private:
  IpcErrorHandler handler_;
};

}  // namespace

void FakeIpcConnection::setExportedInterface(std::shared_ptr<const IpcInterface> interface) {
  std::lock_guard lock(mutex_);
  exportedInterface_ = std::move(interface);
}
void FakeIpcConnection::setExportedObject(std::shared_ptr<IpcExportedObject> object) {
  std::lock_guard lock(mutex_);
  exportedObject_ = std::move(object);
}
void FakeIpcConnection::setRemoteInterface(std::shared_ptr<const IpcInterface> interface) {
  std::lock_guard lock(mutex_);
  remoteInterface_ = std::move(interface);
}
void FakeIpcConnection::setInvalidationHandler(std::function<void()> handler) {
  std::lock_guard lock(mutex_);
  invalidationHandler_ = std::move(handler);
}
void FakeIpcConnection::setInterruptionHandler(std::function<void()> handler) {
  std::lock_guard lock(mutex_);
  interruptionHandler_ = std::move(handler);
}
void FakeIpcConnection::resume() {
  std::lock_guard lock(mutex_);
  resumed_ = true;
}

void FakeIpcConnection::invalidate() {
  std::function<void()> handler;
  std::shared_ptr<IpcExportedObject> object;
  std::function<void()> interruption;
  {
    std::lock_guard lock(mutex_);
    if (!valid_) return;
    valid_ = false;
    handler = std::move(invalidationHandler_);
    object = std::move(exportedObject_);
    interruption = std::move(interruptionHandler_);
  }
  if (handler) handler();
  // `object` and the handlers are released here, as the real layer lets go of them.
}

bool FakeIpcConnection::isValid() const {
  std::lock_guard lock(mutex_);
  return valid_;
}

std::shared_ptr<IpcRemoteProxy> FakeIpcConnection::remoteObjectProxy(IpcErrorHandler handler) {
  return std::make_shared<UnreachableProxy>(std::move(handler));
}
std::shared_ptr<IpcRemoteProxy> FakeIpcConnection::synchronousRemoteObjectProxy(
    IpcErrorHandler handler) {
  return std::make_shared<UnreachableProxy>(std::move(handler));
}

FakeIpcConnection::Delivery FakeIpcConnection::deliver(const std::string& wireName,
                                                       std::vector<Value> arguments) {
  Delivery delivery;
  std::shared_ptr<const IpcInterface> interface;
  std::shared_ptr<IpcExportedObject> object;
  {
    std::lock_guard lock(mutex_);
    interface = exportedInterface_;
    object = exportedObject_;
  }
  const IpcOperation* op = interface ? interface->find(wireName) : nullptr;
  if (op == nullptr || object == nullptr) {
    delivery.error = "unknown operation " + wireName;
    return delivery;
  }
  if (!IpcInterface::matches(*op, arguments, &delivery.error)) return delivery;
  auto answer = std::make_shared<std::optional<std::vector<Value>>>();
  IpcReply reply;
  if (op->replies) {
    reply = [answer](std::vector<Value> values) {
      if (!answer->has_value()) *answer = std::move(values);
    };
  }
  CurrentScope scope(std::static_pointer_cast<IpcConnection>(shared_from_this()));
  delivery.accepted = object->invoke(*op, arguments, reply);
  if (!delivery.accepted) delivery.error = "unrecognised operation " + wireName;
  delivery.reply = *answer;
  return delivery;
}

bool FakeIpcConnection::resumed() const {
  std::lock_guard lock(mutex_);
  return resumed_;
}
std::shared_ptr<const IpcInterface> FakeIpcConnection::exportedInterface() const {
  std::lock_guard lock(mutex_);
  return exportedInterface_;
}
std::shared_ptr<const IpcInterface> FakeIpcConnection::remoteInterface() const {
  std::lock_guard lock(mutex_);
  return remoteInterface_;
}
std::shared_ptr<IpcExportedObject> FakeIpcConnection::exportedObject() const {
  std::lock_guard lock(mutex_);
  return exportedObject_;
}

}  // namespace typhora::testing
