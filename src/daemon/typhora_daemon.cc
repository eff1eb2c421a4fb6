#include "daemon/typhora_daemon.h"

#include <cstdlib>

#include "platform/log/log.h"
#include "platform/value/plist_number.h"

namespace typhora {
namespace {

constexpr const char* kVersionKey = "version";
constexpr std::int64_t kCurrentVersion = 1;

Platform* installedPlatform = nullptr;

// The stored version as an integer: a missing or non-numeric value reads as 0, and no number,
// however large, reads as negative.
std::int64_t storedVersion(const Value& v) {
  return PlistNumber::integerValue(v).value_or(0);
}

}  // namespace

TyphoraDaemon::TyphoraDaemon(Platform& platform)
    : platform_(platform),
      mainHandlerQueue_(SerialQueue::create(kMainHandlerQueueLabel, &platform.clock)) {}

TyphoraDaemon::~TyphoraDaemon() = default;

void TyphoraDaemon::installPlatform(Platform& platform) {
  installedPlatform = &platform;
}

TyphoraDaemon& TyphoraDaemon::sharedDaemon() {
  // A function-local static is made once, safely against concurrent first calls. The daemon is
  // never destroyed while the process runs.
  static const std::shared_ptr<TyphoraDaemon> daemon = [] {
    if (installedPlatform == nullptr) {
      std::fputs("typhorad: sharedDaemon() called before a platform was installed\n", stderr);
      std::abort();
    }
    return std::make_shared<TyphoraDaemon>(*installedPlatform);
  }();
  return *daemon;
}

bool TyphoraDaemon::startUp() {
  if (!setupForLumoService()) return false;
  setupForScheduledFontDeletion();
  setupForDistributedNotifications();
  setupForBlacklistUpdatedNotification();
  setupForMonitoringFontAssets();
  setup();
  return true;
}

bool TyphoraDaemon::setupForLumoService() {
  listener_ = platform_.ipc.makeNamedListener(kServiceName);
  if (!listener_) {
    TYLog_Error(kTYLogTyphoraDaemon, "cannot open the service %s", kServiceName);
    return false;
  }
  listener_->setDelegate(weak_from_this());
  listener_->resume();
  // From here on connections are admitted on IPC threads while start-up goes on.
  (void)isUserFontInstalled();  // preloads the user-fonts information before the first check-in
  return true;
}

// Start-up steps whose subsystems arm nothing yet.

void TyphoraDaemon::setup() {
  if (storedVersion(platform_.preferences.value(kVersionKey)) > 0) return;
  platform_.fontManager.reset();
  platform_.preferences.setValue(kVersionKey, Value(kCurrentVersion));
  platform_.preferences.synchronize();
}

void TyphoraDaemon::run() {
  platform_.mainQueue.run();
}

Value TyphoraDaemon::blacklistInfo() const {
  std::lock_guard lock(blacklistInfoMutex_);
  return blacklistInfo_;
}

void TyphoraDaemon::setBlacklistInfo(Value list) {
  std::lock_guard lock(blacklistInfoMutex_);
  blacklistInfo_ = std::move(list);
}

}  // namespace typhora
