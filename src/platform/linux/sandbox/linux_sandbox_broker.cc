#include "platform/linux/sandbox/linux_sandbox_broker.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/fd/unique_fd.h"
#include "platform/linux/files/atomic_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/linux/sandbox/unix_read_access.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr std::string_view kTokenVersion = "1";

bool covers(const std::string& allowed, const std::string& path) {
  if (!path.starts_with(allowed)) return false;
  return path.size() == allowed.size() || allowed.back() == '/' || path[allowed.size()] == '/';
}

bool readAll(int fd, unsigned char* out, std::size_t size) {
  std::size_t done = 0;
  while (done < size) {
    ssize_t n = read(fd, out + done, size - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

LinuxSandboxBroker::LinuxSandboxBroker(std::string root, const AppManifestStore& manifests)
    : root_(std::move(root)), manifests_(manifests) {
  if (sodium_init() < 0) TYLog_Error(kTYLogTyphoraDaemon, "sandbox: libsodium cannot start");
}

int LinuxSandboxBroker::sandboxCheck(const AuditToken& token) const {
  if (!ProcessIdentity::isValid(token)) return -1;
  std::optional<AppManifest> manifest = manifests_.manifestForProcess(token);
  return manifest && manifest->sandboxed ? 1 : 0;
}

int LinuxSandboxBroker::sandboxCheck(const AuditToken& token, const std::string& operation,
                                     const std::string& path) const {
  if (operation != kSandboxOperationFileReadData) return -1;
  if (!ProcessIdentity::isValid(token)) return -1;
  std::optional<AppManifest> manifest = manifests_.manifestForProcess(token);
  if (manifest && manifest->sandboxed) {
    for (const std::string& allowed : manifest->readOnlyPaths)
      if (covers(allowed, path)) return 0;
    return 1;
  }
  UnixCredentials who = UnixCredentials::ofProcess(token.pid, token.uid, token.gid);
  bool allowed = mayRead(who, root_.onDisk(path));
  // The groups were read from /proc: they count only if the pid still names the same process.
  if (!ProcessIdentity::isValid(token)) return -1;
  return allowed ? 0 : 1;
}

std::string LinuxSandboxBroker::signedPart(const AuditToken& token, std::string_view path) {
  std::string text(kTokenVersion);
  for (std::uint64_t field :
       {std::uint64_t(token.pid), token.startTime, token.exeDevice, token.exeInode}) {
    text += ';';
    text += std::to_string(field);
  }
  text += ';';
  text += path;
  return text;
}

std::optional<std::string> LinuxSandboxBroker::mac(const AuditToken& token,
                                                   std::string_view path) const {
  std::optional<Key> secret = key();
  if (!secret) return std::nullopt;
  std::string message = signedPart(token, path);
  std::array<unsigned char, crypto_auth_BYTES> tag{};
  crypto_auth(tag.data(), reinterpret_cast<const unsigned char*>(message.data()), message.size(),
              secret->data());
  std::array<char, crypto_auth_BYTES * 2 + 1> hex{};
  sodium_bin2hex(hex.data(), hex.size(), tag.data(), tag.size());
  return std::string(hex.data());
}

std::optional<std::string> LinuxSandboxBroker::tokenText(const AuditToken& token,
                                                         std::string_view path) const {
  std::optional<std::string> tag = mac(token, path);
  if (!tag) return std::nullopt;
  std::string text = signedPart(token, "");
  text.pop_back();  // the ';' before the empty path
  return text + ";" + *tag + ";" + std::string(path);
}

std::optional<std::string> LinuxSandboxBroker::issueReadOnlyExtension(const std::string& path,
                                                                      const AuditToken& token) {
  if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos)
    return std::nullopt;
  if (!ProcessIdentity::isValid(token)) return std::nullopt;
  return tokenText(token, path);
}

std::optional<std::string> LinuxSandboxBroker::verifyExtension(std::string_view extension,
                                                               const AuditToken& holder) const {
  // The path is what follows the sixth ';' (version, pid, start, device, inode, MAC).
  std::size_t start = 0;
  for (int field = 0; field < 6; ++field) {
    std::size_t semicolon = extension.find(';', start);
    if (semicolon == std::string_view::npos) return std::nullopt;
    start = semicolon + 1;
  }
  std::string_view path = extension.substr(start);
  std::optional<std::string> expected = tokenText(holder, path);
  if (!expected || expected->size() != extension.size() ||
      sodium_memcmp(expected->data(), extension.data(), extension.size()) != 0)
    return std::nullopt;
  return std::string(path);
}

std::optional<LinuxSandboxBroker::Key> LinuxSandboxBroker::key() const {
  std::lock_guard lock(keyMutex_);
  if (!key_) key_ = loadOrCreateKey();
  return key_;
}

std::optional<LinuxSandboxBroker::Key> LinuxSandboxBroker::loadOrCreateKey() const {
  const std::string directory = root_.onDisk("/etc/typhora");
  const std::string path = directory + "/sandbox.key";
  Key key{};
  UniqueFd existing(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
  if (existing.valid() || errno == ELOOP) {
    struct stat info {};
    if (existing.valid() && fstat(existing.get(), &info) == 0 && S_ISREG(info.st_mode) &&
        readAll(existing.get(), key.data(), key.size()))
      return key;
    TYLog_Error(kTYLogTyphoraDaemon, "sandbox: key %@ is unreadable or short", path);
    return std::nullopt;
  }
  std::error_code ec;
  std::filesystem::create_directories(directory, ec);
  crypto_auth_keygen(key.data());
  // Written whole under a temporary name, then linked into place: a reader never sees half a
  // key, and of two processes racing to make one, the first link wins and both use it.
  std::string temporary = path + ".tmp." + std::to_string(getpid());
  UniqueFd fd(open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  bool written = fd.valid() && AtomicFile::writeAll(fd.get(), key) && fsync(fd.get()) == 0;
  bool linked = written && link(temporary.c_str(), path.c_str()) == 0;
  bool lostRace = written && !linked && errno == EEXIST;
  unlink(temporary.c_str());
  if (linked) return key;
  if (lostRace) return loadOrCreateKey();
  TYLog_Error(kTYLogTyphoraDaemon, "sandbox: cannot make key %@", path);
  return std::nullopt;
}

}  // namespace typhora
