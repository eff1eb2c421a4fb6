#include "platform/ipc/audit_token.h"

namespace typhora {

std::string AuditToken::description() const {
  return "{pid " + std::to_string(pid) + ", uid " + std::to_string(uid) + ", gid " +
         std::to_string(gid) + ", start " + std::to_string(startTime) + "}";
}

}  // namespace typhora
