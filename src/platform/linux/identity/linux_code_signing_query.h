// Signing records from the application manifests: a process is signed code when it runs the
// program of a manifest, unchanged.
#pragma once

#include "platform/linux/identity/app_manifest_store.h"
#include "platform/services/code_signing_query.h"

namespace typhora {

class LinuxCodeSigningQuery final : public CodeSigningQuery {
 public:
  explicit LinuxCodeSigningQuery(const AppManifestStore& manifests) : manifests_(manifests) {}
  std::optional<CodeSigningRecord> codeSigningRecord(const AuditToken& token) const override {
    std::optional<AppManifest> manifest = manifests_.manifestForProcess(token);
    if (!manifest) return std::nullopt;
    return CodeSigningRecord(manifest->identifier, manifest->entitlements);
  }

 private:
  const AppManifestStore& manifests_;
};

}  // namespace typhora
