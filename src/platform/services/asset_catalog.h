// The platform's asset service: metadata of the assets of a type, and downloads of a type's
// catalog.
#pragma once

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

class AssetCatalog {
 public:
  using Filters = std::vector<std::pair<std::string, std::string>>;
  virtual ~AssetCatalog() = default;
  // Synchronous: the attribute dictionaries of the assets of `assetType` whose attributes hold
  // every filter's key with exactly its string, in catalog order. Empty when the query fails or
  // finds nothing.
  virtual std::vector<Value> queryMetadata(const std::string& assetType,
                                           const Filters& filters) = 0;
  // Starts a download of the catalog of `assetType`. A discretionary download may be postponed.
  // The completion runs once, on some thread, with 0 for success or an error code.
  virtual void downloadCatalog(const std::string& assetType, bool discretionary,
                               std::function<void(long result)> completion) = 0;
};

}  // namespace typhora
