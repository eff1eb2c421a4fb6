#include "platform/linux/events/linux_event_hub.h"

#include <unistd.h>

#include "platform/linux/events/event_socket_protocol.h"
#include "platform/linux/events/event_socket_session.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

const char* kindName(LaunchEventStreamKind kind) {
  return kind == LaunchEventStreamKind::distributedNotification ? "distributed" : "system";
}

}  // namespace

bool LinuxEventHub::start() {
  listener_ = ipc_.makeNamedListener(kEventSocketName, 0600);
  if (!listener_) return false;
  listener_->setDelegate(weak_from_this());
  listener_->resume();
  return true;
}

bool LinuxEventHub::shouldAcceptNewConnection(IpcListener& /*listener*/,
                                              std::shared_ptr<IpcConnection> connection) {
  // The socket's file mode already keeps others out; the kernel's word on the peer decides.
  const AuditToken peer = connection->auditToken();
  if (peer.isZero() || (peer.uid != 0 && peer.uid != geteuid())) {
    SystemLog("event socket: refused %@", peer.description());
    return false;
  }
  auto session = std::make_shared<EventSocketSession>(weak_from_this());
  connection->setExportedInterface(eventSocketProtocol());
  connection->setExportedObject(session);
  connection->setRemoteInterface(eventWatcherProtocol());
  connection->setInvalidationHandler([session] { session->setConnection(nullptr); });
  session->setConnection(connection);
  connection->resume();
  return true;
}

void LinuxEventHub::post(LaunchEventStreamKind kind, const std::string& name,
                         const Value& userInfo) {
  TYLog_Debug(kTYLogTyphoraDaemon, "notification posted: %@ (%s)", name, kindName(kind));
  // One post at a time: the streams and every watcher see posts in the same order. Nothing
  // below blocks; watchers' messages are only queued.
  std::lock_guard order(postMutex_);
  streams_.deliver(kind, name, userInfo);
  std::vector<std::shared_ptr<IpcConnection>> watchers;
  {
    std::lock_guard lock(mutex_);
    std::erase_if(watchers_, [&watchers](const std::weak_ptr<IpcConnection>& weak) {
      auto watcher = weak.lock();
      if (!watcher || !watcher->isValid()) return true;
      watchers.push_back(std::move(watcher));
      return false;
    });
  }
  // Asynchronous sends: a watcher that does not read is cut off by its own outbound bound.
  for (const auto& watcher : watchers) {
    watcher->remoteObjectProxy([](const std::string&) {})
        ->call(eventop::kNotificationPosted, {Value(name), Value(kindName(kind)), userInfo});
  }
}

void LinuxEventHub::setActivityRunner(ActivityRunner runner) {
  std::lock_guard lock(mutex_);
  activityRunner_ = std::move(runner);
}

bool LinuxEventHub::runActivity(const std::string& identifier) {
  ActivityRunner runner;
  {
    std::lock_guard lock(mutex_);
    runner = activityRunner_;
  }
  return runner && runner(identifier);
}

void LinuxEventHub::setReporter(Reporter reporter) {
  std::lock_guard lock(mutex_);
  reporter_ = std::move(reporter);
}

Value LinuxEventHub::report(const std::string& operation, const Value& argument) {
  Reporter reporter;
  {
    std::lock_guard lock(mutex_);
    reporter = reporter_;
  }
  return reporter ? reporter(operation, argument) : Value(Dictionary());
}

void LinuxEventHub::addWatcher(std::shared_ptr<IpcConnection> connection) {
  std::lock_guard lock(mutex_);
  watchers_.push_back(std::move(connection));
}

}  // namespace typhora
