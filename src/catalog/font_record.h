// Reading a font record of the user-fonts information: its family names (the values of
// "familyName", keyed by PostScript name) and whether it is disabled (absent reads as enabled).
#pragma once

#include <set>
#include <string>
#include <vector>

#include "platform/value/value.h"

namespace typhora {

class FontRecord {
 public:
  static bool isDisabled(const Value& record);
  // The family names in the record's order; a value that is not a string is no name.
  static std::vector<std::string> familyNames(const Value& record);
  static bool hasFamily(const Value& record, const std::string& familyName);
  static bool sharesFamily(const Value& record, const std::set<std::string>& familyNames);
};

}  // namespace typhora
