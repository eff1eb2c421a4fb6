// The daemon's preferences domain as one property-list file: read whole at first use, changed in
// memory, and on synchronize written whole to a new file that is flushed and renamed over the
// old one, so a crash never leaves a torn file.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/storage/preferences_store.h"

namespace typhora {

class PreferencesFileStore final : public PreferencesStore {
 public:
  // `path` is the file on the machine (already mapped under the device root).
  explicit PreferencesFileStore(std::string path);

  Value value(const std::string& key) const override;
  void setValue(const std::string& key, Value value) override;
  bool synchronize() override;

  // Where a domain's file lives under a device root.
  static std::string pathFor(const std::string& root, const std::string& domain);

 private:
  void loadLocked() const;

  std::string path_;
  mutable std::mutex mutex_;
  mutable std::optional<std::map<std::string, Value>> values_;
};

}  // namespace typhora
