// Installed applications are the application manifests.
#pragma once

#include "platform/linux/identity/app_manifest_store.h"
#include "platform/services/app_registry.h"

namespace typhora {

class LinuxAppRegistry final : public AppRegistry {
 public:
  explicit LinuxAppRegistry(const AppManifestStore& manifests) : manifests_(manifests) {}
  std::optional<std::string> shortVersionString(const std::string& identifier) const override {
    std::optional<AppManifest> manifest = manifests_.manifestForIdentifier(identifier);
    if (!manifest) return std::nullopt;
    return manifest->shortVersionString;
  }

 private:
  const AppManifestStore& manifests_;
};

}  // namespace typhora
