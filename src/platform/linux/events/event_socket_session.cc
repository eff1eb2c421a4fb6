#include "platform/linux/events/event_socket_session.h"

#include "platform/linux/events/event_socket_protocol.h"
#include "platform/linux/events/linux_event_hub.h"

namespace typhora {

void EventSocketSession::setConnection(std::shared_ptr<IpcConnection> connection) {
  std::lock_guard lock(mutex_);
  connection_ = std::move(connection);
}

bool EventSocketSession::invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
                                IpcReply reply) {
  auto hub = hub_.lock();
  if (!hub) return false;
  const std::string& name = operation.wireName;
  if (name == eventop::kPostDistributedNotification) {
    hub->post(LaunchEventStreamKind::distributedNotification, *arguments[0].asString(),
              arguments[1]);
  } else if (name == eventop::kPostSystemNotification) {
    hub->post(LaunchEventStreamKind::systemNotification, *arguments[0].asString(), Value());
  } else if (name == eventop::kWatchNotifications) {
    std::lock_guard lock(mutex_);
    if (connection_) hub->addWatcher(connection_);
  } else if (name == eventop::kRunActivity) {
    reply({Value(hub->runActivity(*arguments[0].asString()))});
    return true;
  } else if (name == eventop::kStatusReport || name == eventop::kGrantsReport) {
    reply({hub->report(name, arguments.empty() ? Value() : arguments[0])});
    return true;
  } else {
    return false;
  }
  reply({});
  return true;
}

}  // namespace typhora
