// The asset service's catalogs on Linux. The catalog of an asset type is a property-list file
//   <root>/var/typhora/assets/<asset type>/catalog.plist
// holding an array of attribute dictionaries, one per asset, in catalog order. A download
// replaces it with a copy of the catalog at the type's configured source,
//   <root>/etc/typhora/asset-sources.plist: {"<asset type>": "<machine path of a catalog>"},
// and then announces the new metadata with the system notification
// "<asset type>.cg.cached-metadata-updated".
#pragma once

#include <memory>
#include <string>

#include "platform/dispatch/serial_queue.h"
#include "platform/linux/files/device_root.h"
#include "platform/services/asset_catalog.h"
#include "platform/services/system_notify.h"

namespace typhora {

class LinuxAssetCatalog final : public AssetCatalog {
 public:
  // Download results.
  static constexpr long kDownloaded = 0;
  static constexpr long kNoSource = 1;      // no source configured for the type
  static constexpr long kBadSource = 2;     // the source cannot be read or is not a catalog
  static constexpr long kCannotStore = 3;   // the catalog could not be written
  static constexpr long kBadAssetType = 4;  // not a name that can be a directory

  LinuxAssetCatalog(const std::string& root, SystemNotify& notify);

  std::vector<Value> queryMetadata(const std::string& assetType, const Filters& filters) override;
  // Downloads one at a time on a queue of their own; a discretionary download is not postponed,
  // since nothing here competes for the network.
  void downloadCatalog(const std::string& assetType, bool discretionary,
                       std::function<void(long result)> completion) override;

 private:
  std::string catalogPath(const std::string& assetType) const;
  long download(const std::string& assetType);

  DeviceRoot root_;
  SystemNotify& notify_;
  std::shared_ptr<SerialQueue> queue_;
};

}  // namespace typhora
