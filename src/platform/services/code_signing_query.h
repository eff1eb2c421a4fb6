// Signing identity and entitlements of a process, by its AuditToken.
#pragma once

#include <optional>

#include "platform/ipc/audit_token.h"
#include "platform/services/code_signing_record.h"

namespace typhora {

class CodeSigningQuery {
 public:
  virtual ~CodeSigningQuery() = default;
  // The signing record of the process, or nullopt when none can be made: the all-zero token, a
  // process that has gone or exec'd since the token was taken, or a process the platform does not
  // know as signed code.
  virtual std::optional<CodeSigningRecord> codeSigningRecord(const AuditToken& token) const = 0;
};

}  // namespace typhora
