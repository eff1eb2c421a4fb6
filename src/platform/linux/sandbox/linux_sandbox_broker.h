// Sandboxes from the application manifests. A sandboxed application may read its manifest's
// read-only paths; any other process what its user may read by the permission bits.
//
// Read-only extension tokens are capability strings the broker can verify:
//   "1;<pid>;<start time>;<exe device>;<exe inode>;<MAC>;<path>"
// bound to one process instance, with an HMAC-SHA-512-256 under a key private to the platform
// (<root>/etc/typhora/sandbox.key, made on first use, readable by its owner only). The path comes
// last, so it may hold any character but the zero byte.
#pragma once

#include <array>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/linux/files/device_root.h"
#include "platform/linux/identity/app_manifest_store.h"
#include "platform/services/sandbox_broker.h"

namespace typhora {

class LinuxSandboxBroker final : public SandboxBroker {
 public:
  LinuxSandboxBroker(std::string root, const AppManifestStore& manifests);

  int sandboxCheck(const AuditToken& token) const override;
  int sandboxCheck(const AuditToken& token, const std::string& operation,
                   const std::string& path) const override;
  std::optional<std::string> issueReadOnlyExtension(const std::string& path,
                                                    const AuditToken& token) override;

  // The path that `extension` lets `holder` read; nullopt when this broker did not issue it to
  // that process instance, or it was altered.
  std::optional<std::string> verifyExtension(std::string_view extension,
                                             const AuditToken& holder) const;

 private:
  using Key = std::array<unsigned char, 32>;
  std::optional<Key> key() const;
  std::optional<Key> loadOrCreateKey() const;
  static std::string signedPart(const AuditToken& token, std::string_view path);
  std::optional<std::string> mac(const AuditToken& token, std::string_view path) const;
  std::optional<std::string> tokenText(const AuditToken& token, std::string_view path) const;

  DeviceRoot root_;
  const AppManifestStore& manifests_;
  mutable std::mutex keyMutex_;
  mutable std::optional<Key> key_;
};

}  // namespace typhora
