// Font names against the installed user fonts: which requested families are enabled, disabled
// or unknown, and which provider applications supply a family or a PostScript name.
#include <algorithm>

#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"

namespace typhora {

namespace {

bool isEnabled(const Value& record) {
  return record.get("disabled").asBool() != true;
}

bool hasFamily(const Value& record, const std::string& familyName) {
  const Dictionary* names = record.get("familyName").asDictionary();
  if (names == nullptr) return false;
  return std::any_of(names->entries().begin(), names->entries().end(), [&](const auto& entry) {
    const std::string* family = entry.second.asString();
    return family != nullptr && *family == familyName;
  });
}

const std::vector<DictionaryEntry>& filesOf(const Value& info) {
  static const std::vector<DictionaryEntry> none;
  const Dictionary* files = info.asDictionary();
  return files != nullptr ? files->entries() : none;
}

}  // namespace

bool TyphoraDaemon::isKnownFamilyName(const std::string& familyName, bool* withEnabledState) {
  bool found = false;
  bool enabled = false;
  const Value info = userFontsInfo();
  for (const auto& [path, record] : filesOf(info)) {
    if (!hasFamily(record, familyName)) continue;
    found = true;
    enabled = isEnabled(record);
    break;
  }
  if (withEnabledState != nullptr) *withEnabledState = enabled;
  return found;
}

std::optional<std::string> TyphoraDaemon::knownFamilyNameFromPostScriptName(
    const std::string& postScriptName, bool* withEnabledState) {
  std::optional<std::string> family;
  bool enabled = false;
  const Value info = userFontsInfo();
  for (const auto& [path, record] : filesOf(info)) {
    const std::string* name = record.get("familyName").get(postScriptName).asString();
    if (name == nullptr) continue;
    family = *name;
    enabled = isEnabled(record);
    break;
  }
  if (withEnabledState != nullptr) *withEnabledState = enabled;
  return family;
}

std::vector<std::string> TyphoraDaemon::unknownFontNamesAndEnabledFamilyNames(
    std::vector<std::string>* enabledFamilyNames, std::vector<std::string>* andDisabledFamilyNames,
    const ValueArray& fromRequests) {
  std::set<std::string> enabled, disabled, unknown;
  for (const Value& request : fromRequests) {
    const std::string* family = request.get(kSVFontFamilyNameAttribute).asString();
    const std::string* postScript = request.get(kSVFontNameAttribute).asString();
    bool isOn = false;
    bool familyKnown = false;
    if (family != nullptr && isKnownFamilyName(*family, &isOn)) {
      (isOn ? enabled : disabled).insert(*family);
      familyKnown = true;
    }
    if (postScript != nullptr) {
      if (std::optional<std::string> known =
              knownFamilyNameFromPostScriptName(*postScript, &isOn)) {
        (isOn ? enabled : disabled).insert(*known);
        continue;
      }
    }
    if (familyKnown) continue;
    if (family != nullptr) {
      unknown.insert(*family);
    } else if (postScript != nullptr) {
      unknown.insert(*postScript);
    }
  }
  if (enabledFamilyNames != nullptr) enabledFamilyNames->assign(enabled.begin(), enabled.end());
  if (andDisabledFamilyNames != nullptr) {
    std::erase_if(disabled, [&enabled](const std::string& name) { return enabled.contains(name); });
    andDisabledFamilyNames->assign(disabled.begin(), disabled.end());
  }
  return {unknown.begin(), unknown.end()};  // std::set: ascending byte order
}

std::optional<std::string> TyphoraDaemon::identifierFromFilePath(const std::string& path) {
  return platform_.fontManager.identifierFromDirectoryName(
      std::string(containingDirectoryName(path)));
}

std::set<std::string> TyphoraDaemon::providerIdentifiersFromFamilyName(
    const std::string& familyName) {
  std::set<std::string> providers;
  const Value info = userFontsInfo();
  for (const auto& [path, record] : filesOf(info)) {
    if (!hasFamily(record, familyName)) continue;
    if (std::optional<std::string> identifier = identifierFromFilePath(path))
      providers.insert(*identifier);
  }
  return providers;
}

std::set<std::string> TyphoraDaemon::providerIdentifiersAndFamilyName(
    std::optional<std::string>* familyName, const std::string& fromPostScriptName) {
  std::set<std::string> providers;
  std::optional<std::string> family;
  const Value info = userFontsInfo();
  for (const auto& [path, record] : filesOf(info)) {
    const std::string* name = record.get("familyName").get(fromPostScriptName).asString();
    if (name == nullptr) continue;
    family = *name;  // the last matching file's family is the one reported
    if (std::optional<std::string> identifier = identifierFromFilePath(path))
      providers.insert(*identifier);
  }
  *familyName = family;
  return providers;
}

}  // namespace typhora
