// A connection of the platform's service IPC, from either side.
//
// Ownership: while a connection is open, the IPC layer keeps it alive. When it is invalidated
// (the peer went away, invalidate() was called, or the peer was cut off), the layer runs the
// invalidation handler once, then drops its exported object and both handlers, which breaks any
// cycle through them, and then lets go of the connection.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/ipc/audit_token.h"
#include "platform/ipc/ipc_interface.h"
#include "platform/ipc/ipc_shared_message.h"
#include "platform/value/value.h"

namespace typhora {

// The reply closure of an operation: called at most once, with the reply's values.
using IpcReply = std::function<void(std::vector<Value>)>;
// A failure of a call through a proxy (connection invalidated or interrupted, reply refused).
using IpcErrorHandler = std::function<void(const std::string& error)>;

// The object whose operations a connection serves. invoke() runs on the connection's serial
// queue, with the connection current, and only for operations of the exported interface whose
// arguments matched. `reply` is empty for a one-way operation.
//
// invoke() answers false when the object does not implement the operation: the IPC layer then
// refuses the call as an unrecognised operation (logged with "lumo error: %s - %@", and an error
// reply to the caller when the call expected one), exactly as for an unknown operation.
class IpcExportedObject {
 public:
  virtual ~IpcExportedObject() = default;
  virtual bool invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
                      IpcReply reply) = 0;
};

// Calls operations of the connection's remote interface. An operation that is not in the remote
// interface, or arguments that do not match it, go to the error handler and are not sent.
class IpcRemoteProxy {
 public:
  virtual ~IpcRemoteProxy() = default;
  // Asynchronous proxy: returns at once; `onReply` runs on the connection's queue (with the
  // connection current). Synchronous proxy: returns after `onReply` or the error handler ran.
  // A failed call runs the error handler instead of `onReply`.
  virtual void call(const std::string& wireName, std::vector<Value> arguments,
                    IpcReply onReply = {}) = 0;
};

class IpcConnection : public std::enable_shared_from_this<IpcConnection> {
 public:
  virtual ~IpcConnection() = default;

  virtual void setExportedInterface(std::shared_ptr<const IpcInterface> interface) = 0;
  virtual void setExportedObject(std::shared_ptr<IpcExportedObject> object) = 0;
  virtual void setRemoteInterface(std::shared_ptr<const IpcInterface> interface) = 0;
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;

  // Starts delivering messages; nothing is received before.
  virtual void resume() = 0;
  // Closes the connection; the invalidation handler runs once, asynchronously.
  virtual void invalidate() = 0;
  virtual bool isValid() const = 0;

  virtual std::shared_ptr<IpcRemoteProxy> remoteObjectProxy(IpcErrorHandler errorHandler) = 0;
  virtual std::shared_ptr<IpcRemoteProxy> synchronousRemoteObjectProxy(
      IpcErrorHandler errorHandler) = 0;
  // Sends `message`, a one-way call of the remote interface that other connections send too, as
  // an asynchronous proxy would; a layer that can shares one encoding among them.
  virtual void sendShared(const std::shared_ptr<const IpcSharedMessage>& message,
                          IpcErrorHandler errorHandler);

  // The peer's identity as the kernel told it at connect time.
  virtual AuditToken auditToken() const = 0;

  // The connection whose message (or reply) the calling thread is serving, or nullptr.
  static std::shared_ptr<IpcConnection> current();
  // Makes `connection` current on this thread for the object's lifetime (the IPC layers use it).
  class CurrentScope {
   public:
    explicit CurrentScope(std::shared_ptr<IpcConnection> connection);
    ~CurrentScope();
    CurrentScope(const CurrentScope&) = delete;
    CurrentScope& operator=(const CurrentScope&) = delete;

   private:
    std::shared_ptr<IpcConnection> previous_;
  };
};

// The token of the current connection, or the all-zero token when there is none.
AuditToken currentAuditToken();

}  // namespace typhora
