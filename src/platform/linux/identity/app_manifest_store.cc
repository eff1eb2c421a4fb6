#include "platform/linux/identity/app_manifest_store.h"

#include <fcntl.h>
#include <nettle/sha2.h>
#include <sodium.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <filesystem>

#include "platform/fd/unique_fd.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/identity/pinned_processes.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/log/log.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace {

constexpr std::size_t kMaxManifests = 4096;
constexpr std::size_t kMaxCachedDigests = 1024;

// nettle picks the processor's SHA instructions where it has them: a 1.7 MB program hashes in
// about 1 ms, against 5 ms in portable code.
std::optional<std::string> sha256Hex(int fd) {
  sha256_ctx state;
  sha256_init(&state);
  std::array<unsigned char, 1 << 16> buffer{};
  for (;;) {
    ssize_t n = read(fd, buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return std::nullopt;
    if (n == 0) break;
    sha256_update(&state, static_cast<std::size_t>(n), buffer.data());
  }
  std::array<unsigned char, SHA256_DIGEST_SIZE> digest{};
  sha256_digest(&state, digest.size(), digest.data());
  std::array<char, SHA256_DIGEST_SIZE * 2 + 1> hex{};
  sodium_bin2hex(hex.data(), hex.size(), digest.data(), digest.size());
  return std::string(hex.data());
}

}  // namespace

std::optional<AppManifestStore::ProgramKey> AppManifestStore::programKey(int fd) {
  struct stat info {};
  if (fstat(fd, &info) != 0 || !S_ISREG(info.st_mode)) return std::nullopt;
  return ProgramKey{info.st_dev,         info.st_ino,          info.st_size,
                    info.st_mtim.tv_sec, info.st_mtim.tv_nsec, info.st_ctim.tv_sec,
                    info.st_ctim.tv_nsec};
}

namespace {

bool sameTime(const timespec& a, const timespec& b) {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

}  // namespace

AppManifestStore::AppManifestStore(const std::string& root)
    : directory_(DeviceRoot(root).onDisk("/etc/typhora/apps")) {}

std::shared_ptr<const AppManifestStore::Manifests> AppManifestStore::current() const {
  struct stat info {};
  std::optional<timespec> modified;
  if (stat(directory_.c_str(), &info) == 0) modified = info.st_mtim;
  std::lock_guard lock(mutex_);
  bool unchanged = manifests_ && modified.has_value() == loadedModified_.has_value() &&
                   (!modified || sameTime(*modified, *loadedModified_));
  if (!unchanged) {
    manifests_ = load();
    loadedModified_ = modified;
  }
  return manifests_;
}

std::shared_ptr<const AppManifestStore::Manifests> AppManifestStore::load() const {
  auto manifests = std::make_shared<Manifests>();
  std::error_code ec;
  std::vector<std::filesystem::path> files;
  for (std::filesystem::directory_iterator it(directory_, ec), end; !ec && it != end;
       it.increment(ec)) {
    if (it->path().extension() == ".plist" && files.size() < kMaxManifests)
      files.push_back(it->path());
  }
  std::sort(files.begin(), files.end());
  for (const auto& file : files) {
    std::string error;
    std::optional<Value> plist = PlistReader::readFile(file.string(), {}, &error);
    std::optional<AppManifest> manifest;
    if (plist) manifest = AppManifest::fromValue(*plist, &error);
    if (!manifest) {
      TYLog_Error(kTYLogTyphoraDaemon, "app manifest %@ ignored: %@", file.string(), error);
      continue;
    }
    manifests->push_back(std::move(*manifest));
  }
  return manifests;
}

std::optional<std::string> AppManifestStore::digestOfProgram(const AuditToken& token) const {
  // The program the process runs, opened through the process itself: a file replaced on disk
  // since then is not what gets hashed. A pinned process's held directory saves the path walk.
  constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_CLOEXEC;
  std::shared_ptr<const UniqueFd> pinned = PinnedProcesses::shared().directoryOf(token);
  UniqueFd fd(pinned ? openat(pinned->get(), "exe", kFlags)
                     : open(("/proc/" + std::to_string(token.pid) + "/exe").c_str(), kFlags));
  std::optional<ProgramKey> key = fd.valid() ? programKey(fd.get()) : std::nullopt;
  if (!key || std::get<0>(*key) != token.exeDevice || std::get<1>(*key) != token.exeInode)
    return std::nullopt;
  return digestOfFile(fd.get(), *key);
}

std::optional<std::string> AppManifestStore::digestOfFile(int fd, const ProgramKey& key) const {
  // One thread hashes a file; the others asking for it meanwhile (the first check-ins of many
  // processes of one program) wait for that thread, which is running, not queued.
  // The promise (an allocation) is made only by the thread that hashes, not on every lookup.
  std::optional<std::promise<std::optional<std::string>>> result;
  std::shared_future<std::optional<std::string>> hashedElsewhere;
  {
    std::lock_guard lock(mutex_);
    if (auto it = digests_.find(key); it != digests_.end()) return it->second;
    if (auto it = hashing_.find(key); it != hashing_.end()) {
      hashedElsewhere = it->second;
    } else {
      hashing_.emplace(key, result.emplace().get_future().share());
    }
  }
  if (!result) return hashedElsewhere.get();
  std::optional<std::string> digest = sha256Hex(fd);
  // A file changed while it was hashed gives a digest of neither version: not kept.
  if (digest && programKey(fd) != key) digest.reset();
  {
    std::lock_guard lock(mutex_);
    hashing_.erase(key);
    if (digest) {
      if (digests_.size() >= kMaxCachedDigests) digests_.clear();
      digests_[key] = *digest;
    }
  }
  result->set_value(digest);
  return digest;
}

std::optional<AppManifest> AppManifestStore::manifestForProcess(const AuditToken& token) const {
  std::optional<std::string> program = ProcessIdentity::executablePath(token);
  if (!program) return std::nullopt;
  auto manifests = current();
  auto named = [&](const AppManifest& m) { return m.executable == *program; };
  if (std::none_of(manifests->begin(), manifests->end(), named)) return std::nullopt;
  std::optional<std::string> digest = digestOfProgram(token);
  // The pid may have been reused while the program was opened.
  if (!digest || !ProcessIdentity::isValid(token)) return std::nullopt;
  for (const AppManifest& manifest : *manifests) {
    if (named(manifest) && manifest.sha256 == *digest) return manifest;
  }
  return std::nullopt;
}

std::optional<AppManifest> AppManifestStore::manifestForProgram(const std::string& path,
                                                                int fd) const {
  auto manifests = current();
  auto named = [&](const AppManifest& m) { return m.executable == path; };
  if (std::none_of(manifests->begin(), manifests->end(), named)) return std::nullopt;
  std::optional<ProgramKey> key = programKey(fd);
  std::optional<std::string> digest = key ? digestOfFile(fd, *key) : std::nullopt;
  if (!digest) return std::nullopt;
  for (const AppManifest& manifest : *manifests) {
    if (named(manifest) && manifest.sha256 == *digest) return manifest;
  }
  return std::nullopt;
}

std::optional<AppManifest> AppManifestStore::manifestForIdentifier(
    const std::string& identifier) const {
  auto manifests = current();
  for (const AppManifest& manifest : *manifests) {
    if (manifest.identifier == identifier) return manifest;
  }
  return std::nullopt;
}

}  // namespace typhora
