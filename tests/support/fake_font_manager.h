// Records the registry calls the daemon makes and answers them from what the test set.
// reset() can be held until the test releases it.
#pragma once

#include <atomic>
#include <map>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/dispatch/semaphore.h"
#include "platform/storage/ty_user_font_manager.h"

namespace typhora::testing {

class FakeFontManager final : public TYUserFontManager {
 public:
  void reset() override {
    ++resets_;
    if (holdReset_) {
      resetEntered_.signal();
      resetRelease_.wait();
    }
  }
  int resets() const { return resets_; }
  // The next reset() calls wait inside until releaseReset().
  void holdReset() { holdReset_ = true; }
  void waitUntilResetEntered() { resetEntered_.wait(); }
  void releaseReset() { resetRelease_.signal(); }

  // Provider directories: identifier <-> directory name.
  void setProviderDirectory(const std::string& identifier, const std::string& directoryName) {
    std::lock_guard lock(mutex_);
    directories_[identifier] = directoryName;
  }
  std::optional<std::string> directoryNameFromIdentifier(const std::string& identifier) override {
    std::lock_guard lock(mutex_);
    auto it = directories_.find(identifier);
    return it == directories_.end() ? std::nullopt : std::optional(it->second);
  }
  std::optional<std::string> identifierFromDirectoryName(const std::string& name) override {
    std::lock_guard lock(mutex_);
    for (const auto& [identifier, directory] : directories_)
      if (directory == name) return identifier;
    return std::nullopt;
  }

  void setProfileFontsInfo(Value info) {
    std::lock_guard lock(mutex_);
    profileFontsInfo_ = std::move(info);
  }
  Value profileFontsInfo() override {
    std::lock_guard lock(mutex_);
    return profileFontsInfo_;
  }
  void setUserFontsInfo(Value info) {
    std::lock_guard lock(mutex_);
    userFontsInfo_ = std::move(info);
  }
  Value userFontsInfo() override {
    std::lock_guard lock(mutex_);
    return userFontsInfo_;
  }

  void enableOrDisablePersistentURLs(const std::vector<std::string>& urls, bool enabled) override {
    std::lock_guard lock(mutex_);
    enableCalls_.emplace_back(urls, enabled);
  }
  std::vector<std::pair<std::vector<std::string>, bool>> enableCalls() const {
    std::lock_guard lock(mutex_);
    return enableCalls_;
  }

  // Unregistration of `identifier` reports `error`.
  void failUnregistering(const std::string& identifier, std::string error) {
    std::lock_guard lock(mutex_);
    unregisterErrors_[identifier] = std::move(error);
  }
  // The completion runs on a thread of its own, as the real registry's does.
  void unregisterAndRemoveFontFilesForIdentifier(const std::string& identifier,
                                                 UnregisterCompletion completionHandler) override {
    std::optional<std::string> error;
    {
      std::lock_guard lock(mutex_);
      unregistered_.push_back(identifier);
      if (auto it = unregisterErrors_.find(identifier); it != unregisterErrors_.end())
        error = it->second;
    }
    std::thread([completionHandler = std::move(completionHandler), error] {
      completionHandler(error);
    }).detach();
  }
  std::vector<std::string> unregistered() const {
    std::lock_guard lock(mutex_);
    return unregistered_;
  }

  void synchronizeFontProviders() override { ++providerSynchronizations_; }
  int providerSynchronizations() const { return providerSynchronizations_; }

  // Asset synchronizations complete at once with `assetSyncResult`, after applying
  // `userFontsInfoAfterAssetSync` when one is set.
  void setAssetSyncResult(bool success, std::optional<Value> userFontsInfoAfter = std::nullopt) {
    std::lock_guard lock(mutex_);
    assetSyncResult_ = success;
    userFontsInfoAfterAssetSync_ = std::move(userFontsInfoAfter);
  }
  void synchronizeFontAssets(std::function<void(bool)> completion) override {
    bool result = false;
    {
      std::lock_guard lock(mutex_);
      ++assetSynchronizations_;
      result = assetSyncResult_;
      if (userFontsInfoAfterAssetSync_) userFontsInfo_ = *userFontsInfoAfterAssetSync_;
    }
    completion(result);
  }
  int assetSynchronizations() const {
    std::lock_guard lock(mutex_);
    return assetSynchronizations_;
  }

 private:
  std::atomic<int> resets_{0};
  std::atomic<bool> holdReset_{false};
  Semaphore resetEntered_;
  Semaphore resetRelease_;
  std::atomic<int> providerSynchronizations_{0};

  mutable std::mutex mutex_;
  std::map<std::string, std::string> directories_;
  Value profileFontsInfo_ = Value::dictionary({});
  Value userFontsInfo_ = Value::dictionary({});
  std::vector<std::pair<std::vector<std::string>, bool>> enableCalls_;
  std::map<std::string, std::string> unregisterErrors_;
  std::vector<std::string> unregistered_;
  bool assetSyncResult_ = true;
  std::optional<Value> userFontsInfoAfterAssetSync_;
  int assetSynchronizations_ = 0;
};

}  // namespace typhora::testing
