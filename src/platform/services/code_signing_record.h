// What the platform knows of a running process's code signature: its signing identifier and its
// entitlements. Made by CodeSigningQuery from an AuditToken.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/value.h"

namespace typhora {

class CodeSigningRecord {
 public:
  CodeSigningRecord(std::optional<std::string> signingIdentifier, Value entitlements)
      : signingIdentifier_(std::move(signingIdentifier)), entitlements_(std::move(entitlements)) {}

  // The code-signing identifier, or nullopt when the signature carries none.
  const std::optional<std::string>& signingIdentifier() const { return signingIdentifier_; }
  // The value of the entitlement `name`: any property-list value, or null when it is absent.
  const Value& entitlementValue(std::string_view name) const { return entitlements_.get(name); }

 private:
  std::optional<std::string> signingIdentifier_;
  Value entitlements_;  // a dictionary, or null
};

}  // namespace typhora
