// The event socket "com.zorvane.typhorad.events": how platform components post notifications to
// the daemon, watch the notifications posted, and run the daemon's background activities. Only
// root and the daemon's own user may connect.
#pragma once

#include <memory>

#include "platform/ipc/ipc_interface.h"

namespace typhora {

inline constexpr const char* kEventSocketName = "com.zorvane.typhorad.events";

namespace eventop {
inline constexpr const char* kPostDistributedNotification = "postDistributedNotification:userInfo:";
inline constexpr const char* kPostSystemNotification = "postSystemNotification:";
inline constexpr const char* kWatchNotifications = "watchNotifications";
inline constexpr const char* kRunActivity = "runActivity:";
// Status and grants: the daemon's status, and the fonts issued to applications (one, or all when
// the argument is absent).
inline constexpr const char* kStatusReport = "statusReport";
inline constexpr const char* kGrantsReport = "grantsReport:";
// To a watcher: name, "distributed" or "system", user info or absent.
inline constexpr const char* kNotificationPosted = "notificationPosted:kind:userInfo:";
}  // namespace eventop

// What the event socket serves.
std::shared_ptr<const IpcInterface> eventSocketProtocol();
// What a watcher serves.
std::shared_ptr<const IpcInterface> eventWatcherProtocol();

}  // namespace typhora
