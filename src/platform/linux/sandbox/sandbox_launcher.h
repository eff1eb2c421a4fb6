// Starts a sandboxed application under the kernel's enforcement: finds the program's manifest,
// puts this process under the manifest's Landlock policy and becomes the program. Fails closed:
// no manifest, an unsandboxed one, or a kernel without Landlock, and nothing is run.
#pragma once

#include <string>
#include <vector>

namespace typhora {

class SandboxLauncher {
 public:
  // `root` is the device root (a machine path).
  explicit SandboxLauncher(std::string root) : root_(std::move(root)) {}

  // Runs `argv` (argv[0] is the program: a path, or a name looked up in PATH) in its sandbox.
  // Returns only when it cannot, with the reason in `error`.
  void exec(const std::vector<std::string>& argv, std::string* error) const;

 private:
  static std::string locate(const std::string& program);

  std::string root_;
};

}  // namespace typhora
