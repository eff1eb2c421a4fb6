#include "catalog/font_record.h"

#include <algorithm>

namespace typhora {

bool FontRecord::isDisabled(const Value& record) {
  return record.peek("disabled").asBool() == true;
}

std::vector<std::string> FontRecord::familyNames(const Value& record) {
  std::vector<std::string> names;
  if (const Dictionary* families = record.get("familyName").asDictionary()) {
    for (const auto& [postScriptName, family] : families->entries())
      if (const std::string* name = family.asString()) names.push_back(*name);
  }
  return names;
}

bool FontRecord::hasFamily(const Value& record, const std::string& familyName) {
  const std::vector<std::string> names = familyNames(record);
  return std::find(names.begin(), names.end(), familyName) != names.end();
}

bool FontRecord::sharesFamily(const Value& record, const std::set<std::string>& familyNames) {
  const std::vector<std::string> names = FontRecord::familyNames(record);
  return std::any_of(names.begin(), names.end(), [&familyNames](const std::string& name) {
    return familyNames.contains(name);
  });
}

}  // namespace typhora
