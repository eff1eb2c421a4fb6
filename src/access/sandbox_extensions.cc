// What a caller receives of the user-fonts information, and the sandbox extension tokens that
// open it: directory-wide for enumeration and providers, one per file for issued fonts.
#include "catalog/font_record.h"
#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"
#include "platform/value/utf8.h"

namespace typhora {

namespace {

constexpr const char* kEnumerationPath = "/var/mobile/Library/UserFonts/FontFiles";
constexpr const char* kProviderPathFormat = "/var/mobile/Library/UserFonts/FontFiles/%@";

// The token as the daemon hands it on: its text followed by the terminating zero byte.
Value tokenValue(const std::string& token) {
  Bytes bytes(token.begin(), token.end());
  bytes.push_back(0);
  return Value(std::move(bytes));
}

Value copyForClient(const Value& record, const Value& token) {
  std::vector<DictionaryEntry> fields;
  if (const Dictionary* dictionary = record.asDictionary()) fields = dictionary->entries();
  std::erase_if(fields, [](const DictionaryEntry& field) { return field.first == "disabled"; });
  if (!token.isNull()) {
    std::erase_if(fields, [](const DictionaryEntry& field) { return field.first == "data"; });
    fields.emplace_back("data", token);
  }
  return Value(Dictionary(std::move(fields)));
}

}  // namespace

Value TyphoraDaemon::sandboxExtensionForEnumeration(const AuditToken& token) {
  std::optional<std::string> issued =
      platform_.sandbox.issueReadOnlyExtension(kEnumerationPath, token);
  return issued ? tokenValue(*issued) : Value();
}

Value TyphoraDaemon::sandboxExtensionForFontAssets(const AuditToken& token) {
  const std::string& path = fontAssetsDirectoryPrefix();
  if (platform_.sandbox.sandboxCheck(token, kSandboxOperationFileReadData, path) == 0) return {};
  std::optional<std::string> issued = platform_.sandbox.issueReadOnlyExtension(path, token);
  return issued ? tokenValue(*issued) : Value();
}

Value TyphoraDaemon::sandboxExtensionForProvider(const AuditToken& token,
                                                 const std::string& withDirectoryName) {
  const std::string path = formatLog(kProviderPathFormat, {withDirectoryName});
  if (!isValidUtf8(path)) return {};
  if (platform_.sandbox.sandboxCheck(token, kSandboxOperationFileReadData, path) == 0) return {};
  std::optional<std::string> issued = platform_.sandbox.issueReadOnlyExtension(path, token);
  return issued ? tokenValue(*issued) : Value();
}

Value TyphoraDaemon::filterUserFontInfoForAuditToken(const AuditToken& token,
                                                     bool withEnumerationCapability,
                                                     const FontFilter& withFilter) {
  return filterUserFontEntries(token, withEnumerationCapability, withFilter, nullptr);
}

Value TyphoraDaemon::filterUserFontEntries(const AuditToken& token, bool withEnumerationCapability,
                                           const FontFilter& withFilter,
                                           const std::set<std::string>* onlyPaths) {
  // An enumerating caller receives the cached records whatever its sandbox: no need to ask.
  const bool sandboxed = !withEnumerationCapability && isAuditTokenSandboxed(token);
  const Value info = userFontsInfo();
  const Dictionary* entries = info.asDictionary();
  if (entries == nullptr) return Value(Dictionary());
  std::vector<DictionaryEntry> result;
  auto visit = [&](const std::string& path, const Value& record) {
    bool covered = false;
    if (!withFilter(path, record, &covered)) return;
    if (isAssetStorePath(path)) covered = true;
    if (!sandboxed || withEnumerationCapability) {
      result.emplace_back(path, record);  // the cached record itself
      return;
    }
    if (covered) {
      result.emplace_back(path, copyForClient(record, Value()));
      return;
    }
    // A sandboxed caller that can already read the file gets nothing for it.
    if (platform_.sandbox.sandboxCheck(token, kSandboxOperationFileReadData, path) == 0) return;
    std::optional<std::string> issued = platform_.sandbox.issueReadOnlyExtension(path, token);
    result.emplace_back(path, copyForClient(record, issued ? tokenValue(*issued) : Value()));
  };
  if (onlyPaths != nullptr) {
    // Both are ordered by path: the entries are visited in the same order as by the walk.
    for (const std::string& path : *onlyPaths) {
      if (const Value* record = entries->find(path)) visit(path, *record);
    }
  } else {
    for (const auto& [path, record] : entries->entries()) visit(path, record);
  }
  return Value(Dictionary(std::move(result)));
}

Value TyphoraDaemon::fontInfoForAuditToken(
    const AuditToken& token, bool withEnumuration, bool installation,
    const std::optional<std::string>& identifier,
    const std::optional<std::set<std::string>>& andFileFilters,
    std::optional<std::string>* foundFontDirectoryName) {
  // Every enumerating caller receives the same records: they are filtered once per load.
  if (withEnumuration && !andFileFilters) return enabledUserFontsInfo();
  std::optional<std::string> directory;
  if (installation && identifier && !withEnumuration)
    directory = platform_.fontManager.directoryNameFromIdentifier(*identifier);
  bool found = false;
  Value result = filterUserFontEntries(
      token, withEnumuration,
      [&](const std::string& path, const Value& record, bool* covered) {
        if (andFileFilters && !andFileFilters->contains(path)) return false;
        if (FontRecord::isDisabled(record)) return false;
        if (withEnumuration) return true;
        if (!installation) return false;
        if (!directory || containingDirectoryName(path) != *directory) return false;
        *covered = true;
        found = true;
        return true;
      },
      andFileFilters ? &*andFileFilters : nullptr);
  if (foundFontDirectoryName != nullptr && found) *foundFontDirectoryName = directory;
  return result;
}

void TyphoraDaemon::setupUserInstalledFontsFor(const AuditToken& token,
                                               const AuditToken& /*withCapabilitiesFor*/,
                                               bool hasEnumeration, bool hasFontAccess,
                                               bool isFontProvider,
                                               const std::optional<std::string>& processIdentifier,
                                               const IpcReply& reply) {
  if (!hasEnumeration && !hasFontAccess && !isFontProvider) {
    reply({Value()});
    return;
  }
  mainHandlerQueue().sync([&] {
    Value fontsInfo = Value(Dictionary());
    std::optional<std::string> directory;
    if (hasEnumeration || isFontProvider) {
      fontsInfo = fontInfoForAuditToken(token, hasEnumeration, isFontProvider, processIdentifier,
                                        std::nullopt, &directory);
    }
    if (!hasEnumeration && hasFontAccess && processIdentifier) {
      const std::vector<std::string> issued = issuedFontFilePathsForIdentifier(*processIdentifier);
      const std::set<std::string> wanted(issued.begin(), issued.end());
      Value granted = filterUserFontEntries(
          token, false, [](const std::string&, const Value&, bool*) { return true; }, &wanted);
      // Entries of the same path replace the earlier ones: the later entry wins.
      std::vector<DictionaryEntry> fonts = fontsInfo.asDictionary()->entries();
      for (const auto& entry : granted.asDictionary()->entries()) fonts.push_back(entry);
      fontsInfo = Value(Dictionary(std::move(fonts)));
    }
    // Room for every key up front: "fontsInfo" and at most two of the others.
    std::vector<DictionaryEntry> checkin;
    checkin.reserve(3);
    checkin.emplace_back("fontsInfo", std::move(fontsInfo));
    if (hasEnumeration) {
      if (Value extension = sandboxExtensionForEnumeration(token); !extension.isNull())
        checkin.emplace_back("extension", extension);
      if (Value extension = sandboxExtensionForFontAssets(token); !extension.isNull())
        checkin.emplace_back("extension.fontasset", extension);
    } else if (directory) {
      if (Value extension = sandboxExtensionForProvider(token, *directory); !extension.isNull())
        checkin.emplace_back("extension.provider", extension);
    }
    if (!hasEnumeration && !hasFontAccess) checkin.emplace_back("hide-profilefonts", true);
    reply({Value(Dictionary(std::move(checkin)))});
  });
}

}  // namespace typhora
