// Sandbox checks of a process and read-only file extension tokens for it.
#pragma once

#include <optional>
#include <string>

#include "platform/ipc/audit_token.h"

namespace typhora {

// The operation of a check for reading a file's data.
inline constexpr const char* kSandboxOperationFileReadData = "file-read-data";

class SandboxBroker {
 public:
  virtual ~SandboxBroker() = default;
  // Whether the process runs in a sandbox at all: 0 when it does not; non-zero when it does, and
  // when the check itself fails (a token whose process has gone).
  virtual int sandboxCheck(const AuditToken& token) const = 0;
  // Whether the process may already perform `operation` on `path` (a path filter; no violation is
  // reported): 0 when it may. Any other answer is a refusal or an error.
  virtual int sandboxCheck(const AuditToken& token, const std::string& operation,
                           const std::string& path) const = 0;
  // A token that lets the process read `path` (a file, or a directory and all below it): the
  // token's text, which callers hand on followed by its terminating zero byte; nullopt when no
  // token can be issued.
  virtual std::optional<std::string> issueReadOnlyExtension(const std::string& path,
                                                            const AuditToken& token) = 0;
};

}  // namespace typhora
