// A caller's capabilities: enumeration, font access and installation, from the entitlement
// "com.zorvane.developer.user-fonts" of its signing record, with the block list for enumeration.
#include <algorithm>

#include "access/user_fonts_entitlement.h"
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kFontPickerIdentifier = "com.zorvane.Panelor.FontPicker";
constexpr const char* kBlacklisted = "BLACKLISTED - %@";

}  // namespace

void TyphoraDaemon::capabilitiesFor(const AuditToken& token, bool* allowEnumerate,
                                    bool* allowUserFonts, bool* allowInstallation,
                                    std::optional<std::string>* andIdentifier) {
  *allowEnumerate = *allowUserFonts = *allowInstallation = false;
  *andIdentifier = std::nullopt;
  std::optional<CodeSigningRecord> record = platform_.codeSigning.codeSigningRecord(token);
  if (!record) return;
  const UserFontsEntitlement entitlement = UserFontsEntitlement::of(*record);
  *allowUserFonts = entitlement.appUsage;
  *allowInstallation = entitlement.installation;
  *andIdentifier = record->signingIdentifier();
  *allowEnumerate =
      entitlement.enumeration && andIdentifier->has_value() && isIdentifierAllowed(**andIdentifier);
}

bool TyphoraDaemon::isIdentifierAllowed(const std::string& identifier) {
  const Value list = blacklistInfo();  // one read of the whole list
  const ValueArray* elements = list.asArray();
  if (elements == nullptr) return true;
  for (const Value& element : *elements) {
    // Elements of another shape are skipped: the list comes from catalog data as it stands.
    const ValueArray* refused = element.get(identifier).asArray();
    if (refused == nullptr) continue;
    std::optional<std::string> version = platform_.appRegistry.shortVersionString(identifier);
    if (version && containsString(*refused, *version)) {
      SystemLog(kBlacklisted, identifier);
      return false;
    }
  }
  return true;
}

bool TyphoraDaemon::isAuditTokenSandboxed(const AuditToken& token) {
  return platform_.sandbox.sandboxCheck(token) != 0;
}

bool TyphoraDaemon::isCurrentConnectionFontPicker() {
  std::optional<CodeSigningRecord> record =
      platform_.codeSigning.codeSigningRecord(currentAuditToken());
  return record && record->signingIdentifier() == kFontPickerIdentifier;
}

}  // namespace typhora
