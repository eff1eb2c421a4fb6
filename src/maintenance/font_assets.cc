// The font registry's mirror of the asset store: kept in step by watching the store, and read on
// request for the mirrored copies of named assets.
#include <mutex>
#include <set>

#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kMonitorQueueLabel = "com.zorvane.typhorad.fontAssetsMonitor";
constexpr double kMonitorLatencySeconds = 3.0;
constexpr const char* kUserFontsEntitlement = "com.zorvane.developer.user-fonts";
constexpr const char* kNonAssetPath = "synchronizeFontAssets got a non-asset font file path: %@";
constexpr const char* kEventStreamCallback = "FontAssetsEventStreamCallback - %@";
constexpr const char* kSynchronizeResult = "synchronizeFontAssets result - %s";
constexpr std::string_view kAssetData = "AssetData";

// The asset name of an asset-store font file ("<store>/<asset>/AssetData/<file>"), or empty.
std::string_view assetNameOfStoreFile(std::string_view path) {
  if (!isAssetStorePath(path) || containingDirectoryName(path) != kAssetData) return {};
  return containingDirectoryName(parentDirectoryPath(path));
}

// The asset store's event stream, kept for the life of the process; touched only on the
// monitor queue.
std::unique_ptr<FileEventStream>& monitorStream() {
  static auto* const stream = new std::unique_ptr<FileEventStream>();
  return *stream;
}

}  // namespace

std::shared_ptr<SerialQueue> TyphoraDaemon::fontAssetsMonitorQueue() {
  static const std::shared_ptr<SerialQueue> queue = SerialQueue::create(kMonitorQueueLabel);
  return queue;
}

void TyphoraDaemon::setupForMonitoringFontAssets() {
  Platform& platform = platform_;
  fontAssetsMonitorQueue()->async([&platform] {
    platform.fontManager.synchronizeFontAssets([&platform](bool) {
      auto stream = platform.fileEvents.createStream(
          {std::string(kAssetStoreDirectory)}, kMonitorLatencySeconds,
          [&platform](const std::vector<std::string>& paths) {
            ValueArray described(paths.begin(), paths.end());
            TYLog_Debug(kTYLogTyphoraDaemon, kEventStreamCallback, Value(std::move(described)));
            platform.fontManager.synchronizeFontAssets([](bool success) {
              TYLog_Debug(kTYLogTyphoraDaemon, kSynchronizeResult, success ? "success" : "fail");
            });
          });
      stream->setDispatchQueue(fontAssetsMonitorQueue());
      stream->start();
      monitorStream() = std::move(stream);
    });
  });
}

void TyphoraDaemon::synchronizeFontAssets(const std::vector<std::string>& paths,
                                          const IpcReply& reply) {
  std::optional<CodeSigningRecord> record =
      platform_.codeSigning.codeSigningRecord(currentAuditToken());
  const ValueArray* capabilities =
      record ? record->entitlementValue(kUserFontsEntitlement).asArray() : nullptr;
  auto holds = [capabilities](const char* name) {
    for (const Value& item : *capabilities)
      if (const std::string* text = item.asString(); text != nullptr && *text == name) return true;
    return false;
  };
  if (capabilities == nullptr || !(holds("font-enumeration") || holds("app-usage"))) {
    reply({Value(false), Value()});
    return;
  }
  std::set<std::string> assets;
  for (const std::string& path : paths) {
    std::string_view asset = assetNameOfStoreFile(path);
    if (asset.empty()) {
      TYLog_Error(kTYLogTyphoraDaemon, kNonAssetPath, path);
      continue;
    }
    assets.emplace(asset);
  }
  // What the reply carries: the information as found now, or as rebuilt by a synchronisation
  // whose completion ran before the registry returned. A later completion finds the reply gone
  // and only updates this shared slot.
  struct Found {
    std::mutex mutex;
    Value fonts;
  };
  auto found = std::make_shared<Found>();
  auto named = std::make_shared<const std::set<std::string>>(std::move(assets));
  auto rebuild = [self = shared_from_this(), found, named] {
    std::vector<DictionaryEntry> entries;
    self->mainHandlerQueue().sync([&] {
      const Value info = self->platform_.fontManager.userFontsInfo();
      if (const Dictionary* all = info.asDictionary()) {
        for (const auto& [path, entry] : all->entries()) {
          if (isFontAssetPath(path) && named->contains(std::string(containingDirectoryName(path))))
            entries.emplace_back(path, entry);
        }
      }
    });
    std::lock_guard lock(found->mutex);
    found->fonts = Value(Dictionary(std::move(entries)));
  };
  rebuild();
  if (named->size() > found->fonts.asDictionary()->size())
    platform_.fontManager.synchronizeFontAssets([rebuild](bool) { rebuild(); });
  Value fonts;
  {
    std::lock_guard lock(found->mutex);
    fonts = found->fonts;
  }
  std::vector<DictionaryEntry> answer{{"fontsInfo", fonts}};
  if (Value extension = sandboxExtensionForFontAssets(currentAuditToken()); !extension.isNull())
    answer.emplace_back("extension.fontasset", extension);
  reply({Value(true), Value(Dictionary(std::move(answer)))});
}

}  // namespace typhora
