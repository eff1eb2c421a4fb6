#include "support/fake_ipc_connection.h"

namespace typhora::testing {
namespace {

// One-way calls that match the remote interface are recorded on the connection, as sent to a
// peer that never answers; calls expecting a reply, or made once the connection is invalid, fail
// at once as calls to a gone peer do.
class RecordingProxy final : public IpcRemoteProxy {
 public:
  RecordingProxy(FakeIpcConnection& connection, IpcErrorHandler handler)
      : connection_(connection), handler_(std::move(handler)) {}
  void call(const std::string& wireName, std::vector<Value> arguments, IpcReply) override {
    std::string why;
    auto remote = connection_.remoteInterface();
    const IpcOperation* operation = remote ? remote->find(wireName) : nullptr;
    if (operation == nullptr || !IpcInterface::matches(*operation, arguments, &why) ||
        operation->replies || !connection_.isValid()) {
      if (handler_) handler_("no peer answers " + wireName + " on a fake connection " + why);
      return;
    }
    connection_.recordSent(wireName, std::move(arguments));
  }

 private:
  FakeIpcConnection& connection_;
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
  return std::make_shared<RecordingProxy>(*this, std::move(handler));
}
std::shared_ptr<IpcRemoteProxy> FakeIpcConnection::synchronousRemoteObjectProxy(
    IpcErrorHandler handler) {
  return std::make_shared<RecordingProxy>(*this, std::move(handler));
}

void FakeIpcConnection::recordSent(const std::string& wireName, std::vector<Value> arguments) {
  std::lock_guard lock(mutex_);
  sent_.push_back({wireName, std::move(arguments)});
}

std::vector<FakeIpcConnection::Sent> FakeIpcConnection::sent() const {
  std::lock_guard lock(mutex_);
  return sent_;
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
