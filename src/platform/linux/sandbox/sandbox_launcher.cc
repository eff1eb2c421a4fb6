#include "platform/linux/sandbox/sandbox_launcher.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <sstream>

#include "platform/fd/unique_fd.h"
#include "platform/linux/identity/app_manifest_store.h"
#include "platform/linux/sandbox/landlock_abi.h"
#include "platform/linux/sandbox/landlock_enforcer.h"
#include "platform/linux/sandbox/landlock_policy.h"

extern char** environ;

namespace typhora {

std::string SandboxLauncher::locate(const std::string& program) {
  if (program.find('/') != std::string::npos) return program;
  const char* path = std::getenv("PATH");
  std::istringstream directories(path != nullptr ? path : "/usr/bin:/bin");
  for (std::string directory; std::getline(directories, directory, ':');) {
    const std::string candidate = (directory.empty() ? "." : directory) + "/" + program;
    if (access(candidate.c_str(), X_OK) == 0) return candidate;
  }
  return program;
}

void SandboxLauncher::exec(const std::vector<std::string>& argv, std::string* error) const {
  if (argv.empty()) {
    *error = "no program to run";
    return;
  }
  std::error_code ec;
  const std::string program = std::filesystem::canonical(locate(argv[0]), ec).string();
  const std::string deviceRoot = std::filesystem::canonical(root_, ec).string();
  // The bytes hashed are the bytes run: the program is executed through this descriptor.
  UniqueFd fd(program.empty() ? -1 : open(program.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid() || deviceRoot.empty()) {
    *error = (fd.valid() ? "cannot find the device root " + root_ : "cannot open " + argv[0]) +
             ": " + std::strerror(errno);
    return;
  }
  const std::optional<AppManifest> manifest =
      AppManifestStore(deviceRoot).manifestForProgram(program, fd.get());
  if (!manifest) {
    *error = "no application manifest under " + deviceRoot + " names " + program +
             " with its SHA-256: refusing to run it";
    return;
  }
  if (!manifest->sandboxed) {
    *error = manifest->identifier + " is not a sandboxed application: refusing to run it";
    return;
  }
  const int abi = landlock::abiVersion();
  if (abi < 1) {
    *error = std::string("this kernel offers no Landlock (") + std::strerror(errno) +
             "): refusing to run " + manifest->identifier + " unconfined";
    return;
  }
  std::optional<LandlockPolicy> policy =
      LandlockPolicy::forApplication(*manifest, deviceRoot, program, abi, error);
  if (!policy || !LandlockEnforcer::enforce(*policy, deviceRoot, error)) return;
  std::vector<char*> args;
  for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
  args.push_back(nullptr);
  execveat(fd.get(), "", args.data(), environ, AT_EMPTY_PATH);
  *error = "cannot run " + program + ": " + std::strerror(errno);
}

}  // namespace typhora
