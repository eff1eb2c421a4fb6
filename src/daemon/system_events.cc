// Applications removed from the device take their fonts with them: the registry unregisters
// what they installed, one application at a time, and the ledger forgets what they were issued.
#include "daemon/typhora_daemon.h"
#include "platform/dispatch/semaphore.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kApplicationUnregistered = "com.zorvane.Apploom.applicationUnregistered";
constexpr const char* kBundleIdentifiers = "bundleIDs";
constexpr const char* kUnregisteringError = "unregistering %@ error - %@";
constexpr const char* kSynchronizingProviders = "synchroning FontProviders";

}  // namespace

void TyphoraDaemon::setupForDistributedNotifications() {
  auto self = shared_from_this();  // the handler holds the daemon
  platform_.launchEvents.setEventHandler(
      LaunchEventStreamKind::distributedNotification, platform_.mainQueue,
      [self](const Value& event) { self->handleDistributedNotification(event); });
}

void TyphoraDaemon::handleDistributedNotification(const Value& event) {
  const std::string* name = event.get(kLaunchEventNameKey).asString();
  if (name == nullptr || *name != kApplicationUnregistered) return;
  const Value& userInfo = event.get(kLaunchEventUserInfoKey);
  if (userInfo.asDictionary() == nullptr) return;
  const ValueArray* identifiers = userInfo.get(kBundleIdentifiers).asArray();
  Semaphore unregistered;
  for (const Value& item : identifiers != nullptr ? *identifiers : ValueArray{}) {
    const std::string* identifier = item.asString();
    if (identifier == nullptr) continue;
    // The registry answers on another thread; the next application waits for this one.
    platform_.fontManager.unregisterAndRemoveFontFilesForIdentifier(
        *identifier,
        [&unregistered, identifier = *identifier](const std::optional<std::string>& error) {
          if (error) TYLog_Debug(kTYLogTyphoraDaemon, kUnregisteringError, identifier, *error);
          unregistered.signal();
        });
    unregistered.wait();
    mainHandlerQueue().async([self = shared_from_this(), identifier = *identifier] {
      self->forgetClientApplication(identifier);
    });
  }
  synchronizeFontProviders();
}

void TyphoraDaemon::synchronizeFontProviders() {
  TYLog(kTYLogTyphoraDaemon, kSynchronizingProviders);
  platform_.fontManager.synchronizeFontProviders();
}

}  // namespace typhora
