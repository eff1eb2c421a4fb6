#include "platform/linux/events/linux_launch_event_stream.h"

#include "platform/log/log.h"

namespace typhora {

void LinuxLaunchEventStream::setEventHandler(LaunchEventStreamKind kind, SerialQueue& queue,
                                             Handler handler) {
  std::lock_guard lock(mutex_);
  Stream& stream = streams_[kind];
  stream.queue = &queue;
  stream.handler = std::move(handler);
  for (Value& event : stream.waiting)
    queue.async([handler = stream.handler, event = std::move(event)] { handler(event); });
  stream.waiting.clear();
}

bool LinuxLaunchEventStream::deliver(LaunchEventStreamKind kind, const std::string& name,
                                     const Value& userInfo) {
  if (!configuration_.delivers(kind, name)) return false;
  std::vector<DictionaryEntry> fields{{kLaunchEventNameKey, Value(name)}};
  if (kind == LaunchEventStreamKind::distributedNotification && !userInfo.isNull())
    fields.emplace_back(kLaunchEventUserInfoKey, userInfo);
  Value event(Dictionary(std::move(fields)));

  std::lock_guard lock(mutex_);
  Stream& stream = streams_[kind];
  if (stream.handler) {
    stream.queue->async([handler = stream.handler, event = std::move(event)] { handler(event); });
    return true;
  }
  if (stream.waiting.size() >= kMaxWaitingEvents) {
    TYLog_Error(kTYLogTyphoraDaemon, "launch events: dropped %@, no handler yet", name);
    return false;
  }
  stream.waiting.push_back(std::move(event));
  return true;
}

}  // namespace typhora
