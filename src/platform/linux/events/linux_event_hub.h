// The platform's notification hub on Linux, behind the event socket: it hands posted
// notifications to the daemon's launch event streams and to every watching peer, and runs the
// daemon's background activities on request. Only root and the daemon's own user may connect;
// the socket file is private to its owner.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/ipc/ipc_listener.h"
#include "platform/linux/events/linux_launch_event_stream.h"
#include "platform/linux/lumo/lumo_service.h"

namespace typhora {

class LinuxEventHub final : public IpcListenerDelegate,
                            public std::enable_shared_from_this<LinuxEventHub> {
 public:
  using ActivityRunner = std::function<bool(const std::string& identifier)>;
  // Answers a status or grants operation of the event socket (its wire name) with a dictionary.
  using Reporter = std::function<Value(const std::string& operation, const Value& argument)>;

  LinuxEventHub(LumoService& ipc, LinuxLaunchEventStream& streams) : ipc_(ipc), streams_(streams) {}

  // Opens the event socket; false when it cannot be opened (logged).
  bool start();
  void post(LaunchEventStreamKind kind, const std::string& name, const Value& userInfo);
  void setActivityRunner(ActivityRunner runner);
  bool runActivity(const std::string& identifier);
  void addWatcher(std::shared_ptr<IpcConnection> connection);
  void setReporter(Reporter reporter);
  // An empty dictionary until a reporter is set.
  Value report(const std::string& operation, const Value& argument);

  bool shouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;

 private:
  LumoService& ipc_;
  LinuxLaunchEventStream& streams_;
  std::shared_ptr<IpcListener> listener_;
  std::mutex postMutex_;  // held across one whole post
  std::mutex mutex_;      // watchers_, activityRunner_ and reporter_
  std::vector<std::weak_ptr<IpcConnection>> watchers_;
  ActivityRunner activityRunner_;
  Reporter reporter_;
};

}  // namespace typhora
