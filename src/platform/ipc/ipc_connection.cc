#include "platform/ipc/ipc_connection.h"

namespace typhora {
namespace {

thread_local std::shared_ptr<IpcConnection> currentConnection;

}  // namespace

std::shared_ptr<IpcConnection> IpcConnection::current() {
  return currentConnection;
}

IpcConnection::CurrentScope::CurrentScope(std::shared_ptr<IpcConnection> connection)
    : previous_(std::exchange(currentConnection, std::move(connection))) {}

IpcConnection::CurrentScope::~CurrentScope() {
  currentConnection = std::move(previous_);
}

void IpcConnection::sendShared(const std::shared_ptr<const IpcSharedMessage>& message,
                               IpcErrorHandler errorHandler) {
  remoteObjectProxy(std::move(errorHandler))->call(message->wireName(), message->arguments());
}

AuditToken currentAuditToken() {
  return currentConnection ? currentConnection->auditToken() : AuditToken{};
}

}  // namespace typhora
