// An asset catalog held in memory. Queries filter it like the real one and are counted;
// downloads wait until the test completes them.
#pragma once

#include <map>
#include <mutex>
#include <vector>

#include "platform/services/asset_catalog.h"

namespace typhora::testing {

class FakeAssetCatalog final : public AssetCatalog {
 public:
  struct Download {
    std::string assetType;
    bool discretionary = false;
    std::function<void(long)> completion;
  };

  void setAssets(const std::string& assetType, std::vector<Value> attributes) {
    std::lock_guard lock(mutex_);
    assets_[assetType] = std::move(attributes);
  }
  int queries() const {
    std::lock_guard lock(mutex_);
    return queries_;
  }
  std::vector<Download> downloads() const {
    std::lock_guard lock(mutex_);
    return downloads_;
  }
  // Runs the completion of download `index` with `result`.
  void completeDownload(std::size_t index, long result) {
    std::function<void(long)> completion;
    {
      std::lock_guard lock(mutex_);
      completion = downloads_.at(index).completion;
    }
    completion(result);
  }

  std::vector<Value> queryMetadata(const std::string& assetType, const Filters& filters) override {
    std::lock_guard lock(mutex_);
    ++queries_;
    std::vector<Value> found;
    for (const Value& attributes : assets_[assetType]) {
      bool matches = true;
      for (const auto& [key, wanted] : filters) {
        const std::string* have = attributes.get(key).asString();
        matches = matches && have != nullptr && *have == wanted;
      }
      if (matches) found.push_back(attributes);
    }
    return found;
  }
  void downloadCatalog(const std::string& assetType, bool discretionary,
                       std::function<void(long)> completion) override {
    std::lock_guard lock(mutex_);
    downloads_.push_back({assetType, discretionary, std::move(completion)});
  }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, std::vector<Value>> assets_;
  int queries_ = 0;
  std::vector<Download> downloads_;
};

}  // namespace typhora::testing
