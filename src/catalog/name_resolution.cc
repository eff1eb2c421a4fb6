// Font names against the installed user fonts: which requested families are enabled, disabled
// or unknown, and which provider applications supply a family or a PostScript name. Look-ups go
// through the name index of the loaded information; providers are asked of the registry on each
// call, as a provider's directory may come and go between font changes.
#include <algorithm>

#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"

namespace typhora {

bool TyphoraDaemon::isKnownFamilyName(const std::string& familyName, bool* withEnabledState) {
  const auto index = userFontsNameIndex();
  const auto& files = index->filesOfFamily(familyName);
  // The first file in path order decides the enabled state.
  if (withEnabledState != nullptr) *withEnabledState = !files.empty() && files.front().enabled;
  return !files.empty();
}

std::optional<std::string> TyphoraDaemon::knownFamilyNameFromPostScriptName(
    const std::string& postScriptName, bool* withEnabledState) {
  const auto index = userFontsNameIndex();
  const auto& files = index->filesOfPostScriptName(postScriptName);
  if (withEnabledState != nullptr) *withEnabledState = !files.empty() && files.front().enabled;
  if (files.empty()) return std::nullopt;
  return std::string(files.front().family);
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
  const auto index = userFontsNameIndex();
  for (const UserFontsNameIndex::File& file : index->filesOfFamily(familyName)) {
    if (std::optional<std::string> identifier = identifierFromFilePath(std::string(file.path)))
      providers.insert(*identifier);
  }
  return providers;
}

std::set<std::string> TyphoraDaemon::providerIdentifiersAndFamilyName(
    std::optional<std::string>* familyName, const std::string& fromPostScriptName) {
  std::set<std::string> providers;
  const auto index = userFontsNameIndex();
  const auto& files = index->filesOfPostScriptName(fromPostScriptName);
  for (const UserFontsNameIndex::File& file : files) {
    if (std::optional<std::string> identifier = identifierFromFilePath(std::string(file.path)))
      providers.insert(*identifier);
  }
  // The last matching file's family is the one reported.
  *familyName = files.empty() ? std::nullopt : std::optional<std::string>(files.back().family);
  return providers;
}

}  // namespace typhora
