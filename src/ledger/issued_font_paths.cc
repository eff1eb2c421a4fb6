// The ledger of font files issued to each application, kept in the preference "issues" in a
// short form: "U/..." under the font files directory, "A/..." under the font assets directory,
// anything else whole.
#include <algorithm>
#include <set>

#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"

namespace typhora {

namespace {

constexpr const char* kIssuesKey = "issues";
constexpr const char* kResetEntitlement = "com.zorvane.Typhora.allow-reset-issued-fonts";
constexpr std::string_view kFontFilesMark = "U/";
constexpr std::string_view kFontAssetsMark = "A/";

std::string storedForm(const std::string& path) {
  if (path.starts_with(fontFilesDirectoryPrefix()))
    return std::string(kFontFilesMark) + path.substr(fontFilesDirectoryPrefix().size());
  if (path.starts_with(fontAssetsDirectoryPrefix()))
    return std::string(kFontAssetsMark) + path.substr(fontAssetsDirectoryPrefix().size());
  return path;
}

std::string expanded(const std::string& stored) {
  if (stored.starts_with(kFontFilesMark))
    return fontFilesDirectoryPrefix() + stored.substr(kFontFilesMark.size());
  if (stored.starts_with(kFontAssetsMark))
    return fontAssetsDirectoryPrefix() + stored.substr(kFontAssetsMark.size());
  return stored;
}

// The stored strings of an entry; strings only (anything else in the array is not a path).
std::set<std::string> storedStrings(const Value& entry) {
  std::set<std::string> strings;
  if (const ValueArray* items = entry.asArray()) {
    for (const Value& item : *items)
      if (const std::string* text = item.asString()) strings.insert(*text);
  }
  return strings;
}

}  // namespace

std::vector<std::string> TyphoraDaemon::sanitizeIssuedFontPaths(
    const std::vector<std::string>& paths) {
  const Value info = userFontsInfo();
  const Dictionary* known = info.asDictionary();
  std::set<std::string> result;
  for (const std::string& path : paths) {
    if (known != nullptr && known->contains(path)) result.insert(storedForm(path));
  }
  return {result.begin(), result.end()};
}

std::vector<std::string> TyphoraDaemon::issuedFontFilePathsLocked(const Dictionary* issues,
                                                                  const std::string& identifier) {
  std::vector<std::string> paths;
  const Value* entry = issues != nullptr ? issues->find(identifier) : nullptr;
  if (const ValueArray* items = entry != nullptr ? entry->asArray() : nullptr) {
    for (const Value& item : *items)
      if (const std::string* text = item.asString()) paths.push_back(expanded(*text));
  }
  return paths;
}

void TyphoraDaemon::writeIssues(std::vector<DictionaryEntry> entries) {
  platform_.preferences.setValue(kIssuesKey, Value(Dictionary(std::move(entries))));
  platform_.preferences.synchronize();
}

std::vector<std::string> TyphoraDaemon::issuedFontFilePathsForIdentifier(
    const std::string& identifier) {
  std::lock_guard lock(ledgerMutex_);
  const Value issues = platform_.preferences.value(kIssuesKey);
  return issuedFontFilePathsLocked(issues.asDictionary(), identifier);
}

void TyphoraDaemon::recordIssuedFontPaths(const std::optional<std::vector<std::string>>& paths,
                                          const std::optional<std::string>& forIdentifier) {
  if (!forIdentifier) return;
  std::lock_guard lock(ledgerMutex_);
  const Value issues = platform_.preferences.value(kIssuesKey);
  const Dictionary* old = issues.asDictionary();
  std::vector<std::string> candidates = paths.value_or(std::vector<std::string>{});
  const Value* entry = old != nullptr ? old->find(*forIdentifier) : nullptr;
  if (entry != nullptr) {
    std::vector<std::string> issued = issuedFontFilePathsLocked(old, *forIdentifier);
    candidates.insert(candidates.end(), issued.begin(), issued.end());
  }
  std::vector<std::string> sanitized = sanitizeIssuedFontPaths(candidates);
  if (entry != nullptr &&
      std::set<std::string>(sanitized.begin(), sanitized.end()) == storedStrings(*entry))
    return;
  std::vector<DictionaryEntry> entries =
      old != nullptr ? old->entries() : std::vector<DictionaryEntry>{};
  ValueArray stored(sanitized.begin(), sanitized.end());
  std::erase_if(entries, [&](const DictionaryEntry& e) { return e.first == *forIdentifier; });
  entries.emplace_back(*forIdentifier, Value(std::move(stored)));
  writeIssues(std::move(entries));
}

void TyphoraDaemon::forgetClientApplication(const std::optional<std::string>& identifier) {
  if (!identifier) return;
  std::lock_guard lock(ledgerMutex_);
  const Value issues = platform_.preferences.value(kIssuesKey);
  const Dictionary* old = issues.asDictionary();
  if (old == nullptr || !old->contains(*identifier)) return;
  std::vector<DictionaryEntry> entries = old->entries();
  std::erase_if(entries, [&](const DictionaryEntry& e) { return e.first == *identifier; });
  writeIssues(std::move(entries));
}

void TyphoraDaemon::resetIssuedFontsFor(const std::string& identifier, const IpcReply& reply) {
  std::optional<CodeSigningRecord> record =
      platform_.codeSigning.codeSigningRecord(currentAuditToken());
  if (record && record->entitlementValue(kResetEntitlement).asBool() == true)
    forgetClientApplication(identifier);
  reply({});
}

}  // namespace typhora
