// The platform's registry of application manifests, one file per application under
// <root>/etc/typhora/apps/. A running process is an application when the program it runs is
// the manifest's executable and hashes to the manifest's SHA-256; anything else (an unknown
// program, a program replaced since, a process that has gone or exec'd) has no manifest.
//
// Manifests are reloaded when the directory changes; installers replace files by rename, which
// is what the directory's modification time shows.
#pragma once

#include <sys/stat.h>

#include <future>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "platform/ipc/audit_token.h"
#include "platform/linux/identity/app_manifest.h"

namespace typhora {

class AppManifestStore {
 public:
  explicit AppManifestStore(const std::string& root);

  std::optional<AppManifest> manifestForProcess(const AuditToken& token) const;
  // The manifest of the program at machine path `path`, open as `fd` (read from its start): the
  // manifest's executable is `path` and the file's bytes hash to its SHA-256.
  std::optional<AppManifest> manifestForProgram(const std::string& path, int fd) const;
  std::optional<AppManifest> manifestForIdentifier(const std::string& identifier) const;

 private:
  using Manifests = std::vector<AppManifest>;
  std::shared_ptr<const Manifests> current() const;
  std::shared_ptr<const Manifests> load() const;
  std::optional<std::string> digestOfProgram(const AuditToken& token) const;

  std::string directory_;
  mutable std::mutex mutex_;
  mutable std::optional<timespec> loadedModified_;
  mutable std::shared_ptr<const Manifests> manifests_;
  // SHA-256 of programs by (device, inode, size, modification time, change time). The owner of a
  // file can set its modification time back after changing it, but not its change time.
  using ProgramKey = std::tuple<dev_t, ino_t, off_t, std::int64_t, long, std::int64_t, long>;
  static std::optional<ProgramKey> programKey(int fd);
  std::optional<std::string> digestOfFile(int fd, const ProgramKey& key) const;
  mutable std::map<ProgramKey, std::string> digests_;
  mutable std::map<ProgramKey, std::shared_future<std::optional<std::string>>> hashing_;
};

}  // namespace typhora
