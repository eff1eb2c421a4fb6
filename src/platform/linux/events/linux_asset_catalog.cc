#include "platform/linux/events/linux_asset_catalog.h"

#include "platform/linux/files/atomic_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/log/log.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace {

bool matches(const Value& attributes, const AssetCatalog::Filters& filters) {
  for (const auto& [key, wanted] : filters) {
    const std::string* value = attributes.get(key).asString();
    if (value == nullptr || *value != wanted) return false;
  }
  return true;
}

}  // namespace

LinuxAssetCatalog::LinuxAssetCatalog(const std::string& root, SystemNotify& notify)
    : root_(root),
      notify_(notify),
      queue_(SerialQueue::create("com.zorvane.typhora.assetDownloads")) {}

std::string LinuxAssetCatalog::catalogPath(const std::string& assetType) const {
  return root_.onDisk("/var/typhora/assets/" + assetType + "/catalog.plist");
}

std::vector<Value> LinuxAssetCatalog::queryMetadata(const std::string& assetType,
                                                    const Filters& filters) {
  if (!DeviceRoot::isSingleComponent(assetType)) return {};
  std::string error;
  std::optional<Value> catalog = PlistReader::readFile(catalogPath(assetType), {}, &error);
  const ValueArray* assets = catalog ? catalog->asArray() : nullptr;
  if (assets == nullptr) {
    TYLog_Error(kTYLogTyphoraDaemon, "asset catalog %@: %@", assetType,
                catalog ? std::string("not an array") : error);
    return {};
  }
  std::vector<Value> found;
  for (const Value& attributes : *assets) {
    if (attributes.asDictionary() != nullptr && matches(attributes, filters))
      found.push_back(attributes);
  }
  return found;
}

void LinuxAssetCatalog::downloadCatalog(const std::string& assetType, bool /*discretionary*/,
                                        std::function<void(long result)> completion) {
  queue_->async([this, assetType, completion = std::move(completion)] {
    const long result = download(assetType);
    if (result == kDownloaded) notify_.post(assetType + ".cg.cached-metadata-updated");
    if (completion) completion(result);
  });
}

long LinuxAssetCatalog::download(const std::string& assetType) {
  if (!DeviceRoot::isSingleComponent(assetType)) return kBadAssetType;
  std::optional<Value> sources =
      PlistReader::readFile(root_.onDisk("/etc/typhora/asset-sources.plist"), {}, nullptr);
  const std::string* source = sources ? sources->get(assetType).asString() : nullptr;
  if (source == nullptr) return kNoSource;
  std::string error;
  std::optional<Value> catalog = PlistReader::readFile(*source, {}, &error);
  if (!catalog || catalog->asArray() == nullptr) {
    TYLog_Error(kTYLogTyphoraDaemon, "asset catalog source %@: %@", *source,
                catalog ? std::string("not an array") : error);
    return kBadSource;
  }
  if (!AtomicFile::write(catalogPath(assetType), CborCodec::encode(*catalog), 0644, &error)) {
    TYLog_Error(kTYLogTyphoraDaemon, "asset catalog %@: %@", assetType, error);
    return kCannotStore;
  }
  return kDownloaded;
}

}  // namespace typhora
