#include "access/user_fonts_entitlement.h"

#include <algorithm>

namespace typhora {
namespace {

constexpr const char* kUserFontsEntitlement = "com.zorvane.developer.user-fonts";
constexpr const char* kFontEnumeration = "font-enumeration";
constexpr const char* kAppUsage = "app-usage";
constexpr const char* kSystemInstallation = "system-installation";

}  // namespace

bool containsString(const ValueArray& items, const std::string& wanted) {
  return std::any_of(items.begin(), items.end(), [&wanted](const Value& item) {
    const std::string* text = item.asString();
    return text != nullptr && *text == wanted;
  });
}

UserFontsEntitlement UserFontsEntitlement::of(const CodeSigningRecord& record) {
  UserFontsEntitlement values;
  const ValueArray* items = record.entitlementValue(kUserFontsEntitlement).asArray();
  if (items == nullptr) return values;
  values.enumeration = containsString(*items, kFontEnumeration);
  values.appUsage = containsString(*items, kAppUsage);
  values.installation = containsString(*items, kSystemInstallation);
  return values;
}

}  // namespace typhora
