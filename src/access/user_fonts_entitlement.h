// The values of a signing record's entitlement "com.zorvane.developer.user-fonts": an array that
// may name enumeration, use by the application, and installation. Any other value names none.
#pragma once

#include "platform/services/code_signing_record.h"

namespace typhora {

struct UserFontsEntitlement {
  bool enumeration = false;   // "font-enumeration"
  bool appUsage = false;      // "app-usage"
  bool installation = false;  // "system-installation"

  static UserFontsEntitlement of(const CodeSigningRecord& record);
};

// Whether `items` holds the string `wanted` (elements of other types never match).
bool containsString(const ValueArray& items, const std::string& wanted);

}  // namespace typhora
