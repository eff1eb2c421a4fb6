// The font-access block list, loaded from the asset catalog when the asset service announces new
// assets or new catalog metadata, and the scheduled activity that keeps the catalog fresh.
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kAssetType = "com.zorvane.Cargell.ScrivaneAssets";
constexpr const char* kNewAssetInstalled =
    "com.zorvane.Cargell.ScrivaneAssets.cg.new-asset-installed";
constexpr const char* kCachedMetadataUpdated =
    "com.zorvane.Cargell.ScrivaneAssets.cg.cached-metadata-updated";
constexpr const char* kFontAccessAttribute = "FontAccess";
constexpr const char* kCheckAssetUpdateActivity = "com.zorvane.typhorad.check-asset-update";
constexpr const char* kAssetHandlerQueueLabel = "com.zorvane.typhorad.assetHandler";
constexpr const char* kAssetCatalogUpdated = "asset catalog updated. (%d)";

// Where catalog downloads start: off every queue of the daemon. The platform layer has no
// priorities, so this is a serial queue of its own; it only starts the download.
SerialQueue& backgroundQueue() {
  static const std::shared_ptr<SerialQueue> queue =
      SerialQueue::create("com.zorvane.typhorad.background");
  return *queue;
}

}  // namespace

SerialQueue& TyphoraDaemon::assetHandlerQueue() {
  // Process-wide, not the daemon's: made on the first call and never released.
  static const std::shared_ptr<SerialQueue> queue = SerialQueue::create(kAssetHandlerQueueLabel);
  return *queue;
}

void TyphoraDaemon::setupForBlacklistUpdatedNotification() {
  auto self = shared_from_this();
  platform_.launchEvents.setEventHandler(
      LaunchEventStreamKind::systemNotification, platform_.mainQueue, [self](const Value& event) {
        const std::string* name = event.get(kLaunchEventNameKey).asString();
        if (name == nullptr || (*name != kNewAssetInstalled && *name != kCachedMetadataUpdated))
          return;
        self->assetHandlerQueue().async([self] { self->loadBlacklist(); });
      });
  platform_.activities.registerActivity(
      kCheckAssetUpdateActivity,
      [self](ScheduledActivityState state) { self->checkAssetUpdate(state); });
}

void TyphoraDaemon::loadBlacklist() {
  TY_ASSERT_ON_QUEUE(assetHandlerQueue());
  ValueArray list;
  for (const Value& attributes : platform_.assetCatalog.queryMetadata(
           kAssetType, {{"_CompatibilityVersion", "1"}, {"type", "FontAccess"}})) {
    const Value& fragment = attributes.get(kFontAccessAttribute);
    if (!fragment.isNull()) list.push_back(fragment);
  }
  setBlacklistInfo(Value(std::move(list)));
}

void TyphoraDaemon::checkAssetUpdate(ScheduledActivityState state) {
  if (state == ScheduledActivityState::checkIn) return;
  backgroundQueue().async([self = shared_from_this()] {
    self->platform_.assetCatalog.downloadCatalog(
        kAssetType, /*discretionary=*/true, [](long result) {
          TYLog_Debug(kTYLogTyphoraDaemon, kAssetCatalogUpdated, static_cast<int>(result));
        });
  });
}

}  // namespace typhora
