// Sandbox extension tokens presented by a process: nothing but a token this broker issued to that
// process instance verifies; a token altered in any byte, or held by another instance, does not.
#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <string>

#include "platform/linux/identity/app_manifest_store.h"
#include "platform/linux/sandbox/linux_sandbox_broker.h"
#include "platform/linux/identity/process_identity.h"

namespace {

struct Broker {
  Broker() {
    char pattern[] = "/tmp/typhora-token-fuzz-XXXXXX";
    root = mkdtemp(pattern);
    std::filesystem::create_directories(root + "/etc/typhora/apps");
    manifests = std::make_unique<typhora::AppManifestStore>(root);
    broker = std::make_unique<typhora::LinuxSandboxBroker>(root, *manifests);
  }
  std::string root;
  std::unique_ptr<typhora::AppManifestStore> manifests;
  std::unique_ptr<typhora::LinuxSandboxBroker> broker;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Broker b;
  static const typhora::AuditToken holder =
      typhora::ProcessIdentity::ofProcess(getpid(), getuid(), getgid());
  const std::string presented(reinterpret_cast<const char*>(data), size);
  if (b.broker->verifyExtension(presented, holder)) __builtin_trap();  // forged
  // A real token, with the input's first bytes choosing one byte to change.
  if (size < 3) return 0;
  const std::string path(reinterpret_cast<const char*>(data) + 3, size - 3);
  std::optional<std::string> token = b.broker->issueReadOnlyExtension(path, holder);
  if (!token) return 0;
  if (b.broker->verifyExtension(*token, holder) != path) __builtin_trap();
  std::string altered = *token;
  const std::size_t at = (static_cast<std::size_t>(data[0]) << 8 | data[1]) % altered.size();
  altered[at] = static_cast<char>(altered[at] ^ (data[2] | 1));
  if (b.broker->verifyExtension(altered, holder)) __builtin_trap();
  // Another process instance cannot use it.
  typhora::AuditToken other = holder;
  other.startTime += 1;
  if (b.broker->verifyExtension(*token, other)) __builtin_trap();
  return 0;
}
