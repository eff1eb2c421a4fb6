// What a sandboxed application may touch, as Landlock rules: read access beneath its manifest's
// read-only paths (daemon paths, beneath the device root), read and execute of what any program
// needs to run (the system's programs, libraries and configuration, a few devices, /proc), its own
// executable, and nothing else. No writes, no TCP, no abstract Unix sockets or signals beyond its
// own domain. Every right the running ABI knows is handled, so a right left out of every rule is
// denied.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/identity/app_manifest.h"

namespace typhora {

struct LandlockRule {
  std::string path;
  std::uint64_t access = 0;
  // A daemon path, opened beneath the device root; otherwise a machine path.
  bool beneathDeviceRoot = false;
};

class LandlockPolicy {
 public:
  // The newest ABI whose rights this code knows by name; a newer kernel is used at this level.
  static constexpr int kNewestKnownAbi = 7;

  // Every filesystem right, network right and scope of `abi` (0 when it has none).
  static std::uint64_t fsRights(int abi);
  static std::uint64_t netRights(int abi);
  static std::uint64_t scopes(int abi);
  // `access` as a rule on a non-directory may hold it: the kernel refuses directory rights there.
  static std::uint64_t forFile(std::uint64_t access);

  // The policy of the sandboxed application `manifest` running `program` (a machine path), with
  // the device root at the machine path `deviceRoot` (canonical). nullopt, with `error`, when
  // the manifest cannot be kept to: the device root lies beneath a directory every program may
  // read, so its other files would be readable too.
  static std::optional<LandlockPolicy> forApplication(const AppManifest& manifest,
                                                      const std::string& deviceRoot,
                                                      const std::string& program, int abi,
                                                      std::string* error);

  int abi() const { return abi_; }
  std::uint64_t handledFs() const { return fsRights(abi_); }
  std::uint64_t handledNet() const { return netRights(abi_); }
  std::uint64_t scoped() const { return scopes(abi_); }
  const std::vector<LandlockRule>& rules() const { return rules_; }

 private:
  int abi_ = 0;
  std::vector<LandlockRule> rules_;
};

}  // namespace typhora
