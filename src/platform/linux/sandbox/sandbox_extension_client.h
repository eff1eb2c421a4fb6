// An application's side of the token exchange: a read-only extension token in, a descriptor of
// the file or directory it names out.
#pragma once

#include <string>

#include "platform/fd/unique_fd.h"

namespace typhora {

struct SandboxExtensionResult {
  UniqueFd fd;        // valid on success
  std::string kind;   // "file" or "directory" on success
  std::string error;  // why not, otherwise
};

class SandboxExtensionClient {
 public:
  explicit SandboxExtensionClient(std::string runtimeDir) : runtimeDir_(std::move(runtimeDir)) {}

  // Connects to the daemon's sandbox socket; invalid with `error` set when it cannot.
  UniqueFd connect(std::string* error) const;
  // Sends `token` on `socket` (a fresh connection) and waits for the answer, at most `seconds`.
  static SandboxExtensionResult exchange(int socket, const std::string& token, int seconds = 10);
  // Both: one exchange on a connection of its own. With `beneath`, the token names a directory
  // and the descriptor is of that entry beneath it (a relative path).
  SandboxExtensionResult open(const std::string& token, const std::string& beneath = "") const;

 private:
  std::string runtimeDir_;
};

}  // namespace typhora
