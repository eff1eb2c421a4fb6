// Listeners of the platform's service IPC: the named service listener, and anonymous listeners
// reachable only through their endpoint.
#pragma once

#include <memory>

#include "platform/ipc/ipc_connection.h"
#include "platform/ipc/ipc_endpoint.h"

namespace typhora {

class IpcListener;

class IpcListenerDelegate {
 public:
  virtual ~IpcListenerDelegate() = default;
  // Runs on an IPC thread for every new connection. Accepting means configuring and resuming
  // `connection` and answering true; a refused connection is invalidated.
  virtual bool shouldAcceptNewConnection(IpcListener& listener,
                                         std::shared_ptr<IpcConnection> connection) = 0;
};

class IpcListener {
 public:
  virtual ~IpcListener() = default;
  // The delegate is held weakly: the caller keeps it alive.
  virtual void setDelegate(std::weak_ptr<IpcListenerDelegate> delegate) = 0;
  virtual void resume() = 0;
  virtual void invalidate() = 0;
  // The endpoint of an anonymous listener (nullptr for a named one).
  virtual std::shared_ptr<const IpcEndpoint> endpoint() const = 0;
};

// Makes listeners and outgoing connections: the IPC part of the platform.
class IpcService {
 public:
  virtual ~IpcService() = default;
  virtual std::shared_ptr<IpcListener> makeNamedListener(const std::string& serviceName) = 0;
  virtual std::shared_ptr<IpcListener> makeAnonymousListener() = 0;
  // A connection to `endpoint`; it connects on resume(). An unreachable endpoint invalidates it.
  virtual std::shared_ptr<IpcConnection> connect(std::shared_ptr<const IpcEndpoint> endpoint) = 0;
  virtual std::shared_ptr<IpcConnection> connectToService(const std::string& serviceName) = 0;
};

}  // namespace typhora
