#include "ipc/font_change_messages.h"

#include <set>

#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"
#include "ipc/font_url.h"
#include "ipc/interface_descriptions.h"
#include "ipc/typhora_handler.h"
#include "platform/log/log.h"
#include "platform/value/plist_number.h"

namespace typhora {

namespace {

constexpr const char* kInvalidPath = "got invalid font path: %@";
constexpr const char* kLumoError = "lumo error: %s - %@";
constexpr const char* kUserFontsSite = "-[TyphoraHandler fontChanged:]_block_invoke";
constexpr const char* kProfileFontsSite = "-[TyphoraHandler fontChanged:]_block_invoke_2";

Value stringList(const std::vector<std::string>& strings) {
  return Value(ValueArray(strings.begin(), strings.end()));
}

std::vector<std::string> urlsOf(const auto& named) {
  std::vector<std::string> urls;
  urls.reserve(named.size());
  for (const auto& item : named) urls.push_back(item.url);
  return urls;
}

std::set<std::string> pathsOf(const auto& named) {
  std::set<std::string> paths;
  for (const auto& item : named) paths.insert(item.path);
  return paths;
}

IpcErrorHandler errorLine(const char* site) {
  return [site](const std::string& error) { SystemLog(kLumoError, site, error); };
}

}  // namespace

FontChangeMessages::FontChangeMessages(TyphoraDaemon& daemon, Value change)
    : daemon_(daemon),
      change_(std::move(change)),
      added_(PlistNumber::boolValue(change_.get("added")).value_or(false)),
      profile_(PlistNumber::integerValue(change_.get("kind")).value_or(0) != 0) {
  if (const ValueArray* urls = change_.get("urls").asArray()) {
    for (const Value& item : *urls) {
      const std::string* url = item.asString();
      std::optional<std::string> path = url != nullptr ? FontUrl::path(*url) : std::nullopt;
      if (path) named_.push_back({*url, std::move(*path)});
    }
  }
  if (profile_ || !added_) return;
  for (const NamedPath& item : named_) {
    if (isFontFilePath(item.path) || isFontAssetPath(item.path)) {
      fonts_.push_back(item);
    } else {
      invalid_.push_back(item.path);
    }
  }
}

void FontChangeMessages::sendTo(const TyphoraHandler& handler) {
  std::shared_ptr<IpcConnection> connection = handler.clientConnection();
  if (profile_) {
    if (connection) sendProfileFonts(*connection);
  } else {
    sendUserFonts(handler, connection.get());
  }
}

std::shared_ptr<const IpcSharedMessage> FontChangeMessages::message(
    Value info, const std::vector<std::string>& urls, bool added) {
  return std::make_shared<const IpcSharedMessage>(
      op::kFontAddedInfo, std::vector<Value>{std::move(info), added ? stringList(urls) : Value(),
                                             added ? Value() : stringList(urls)});
}

void FontChangeMessages::sendUserFonts(const TyphoraHandler& handler, IpcConnection* connection) {
  const bool enumeration = handler.hasEnumerationEntitlement();
  if (!enumeration && !handler.isFontProvider()) return;
  // Every client that may see an addition says which of its paths it refused.
  for (const std::string& path : invalid_) TYLog_Error(kTYLogTyphoraDaemon, kInvalidPath, path);
  if (connection == nullptr) return;
  if (!added_) {
    if (named_.empty()) return;
    if (!everyone_) everyone_ = message(Value(Dictionary()), urlsOf(named_), false);
    connection->sendShared(everyone_, errorLine(kUserFontsSite));
  } else if (enumeration) {
    if (fonts_.empty()) return;
    connection->sendShared(enumeratingAddition(handler, *connection), errorLine(kUserFontsSite));
  } else {
    sendProviderAddition(handler, *connection);
  }
}

const std::shared_ptr<const IpcSharedMessage>& FontChangeMessages::enumeratingAddition(
    const TyphoraHandler& handler, IpcConnection& connection) {
  if (!enumerating_) {
    // The caller's token and provider directory play no part in what an enumerating client sees.
    Value fontsInfo =
        daemon_.fontInfoForAuditToken(connection.auditToken(), true, handler.isFontProvider(),
                                      handler.processIdentifier(), pathsOf(fonts_), nullptr);
    enumerating_ =
        message(Value::dictionary({{"fontsInfo", std::move(fontsInfo)}}), urlsOf(fonts_), true);
  }
  return enumerating_;
}

void FontChangeMessages::sendProviderAddition(const TyphoraHandler& handler,
                                              IpcConnection& connection) {
  const std::optional<std::string> identifier = handler.processIdentifier();
  const std::optional<std::string> directory =
      identifier ? daemon_.platform().fontManager.directoryNameFromIdentifier(*identifier)
                 : std::nullopt;
  if (!directory) return;
  std::vector<NamedPath> taken;
  for (const NamedPath& item : fonts_) {
    if (containingDirectoryName(item.path) == *directory) taken.push_back(item);
  }
  if (taken.empty()) return;
  const AuditToken token = connection.auditToken();
  // A sandboxed provider receives its records without the fields only the daemon reads.
  const bool sandboxed = daemon_.isAuditTokenSandboxed(token);
  auto [slot, first] = providers_.try_emplace((sandboxed ? "s:" : "u:") + *directory);
  ClassFonts& fonts = slot->second;
  if (first) {
    fonts.fontsInfo = daemon_.fontInfoForAuditToken(token, false, true, identifier, pathsOf(taken),
                                                    &fonts.foundDirectory);
  }
  Value extension;
  if (fonts.foundDirectory)
    extension = daemon_.sandboxExtensionForProvider(token, *fonts.foundDirectory);
  if (extension.isNull()) {
    if (!fonts.message)
      fonts.message =
          message(Value::dictionary({{"fontsInfo", fonts.fontsInfo}}), urlsOf(taken), true);
    connection.sendShared(fonts.message, errorLine(kUserFontsSite));
    return;
  }
  // The token is this process's own: so is the message that carries it.
  connection.remoteObjectProxy(errorLine(kUserFontsSite))
      ->call(
          op::kFontAddedInfo,
          {Value::dictionary({{"fontsInfo", fonts.fontsInfo}, {"extension.provider", extension}}),
           stringList(urlsOf(taken)), Value()});
}

void FontChangeMessages::sendProfileFonts(IpcConnection& connection) {
  if (!everyone_) {
    const std::vector<std::string> urls = urlsOf(named_);
    if (!added_) {
      everyone_ = message(Value(), urls, false);
    } else {
      const std::set<std::string> paths = pathsOf(named_);
      std::vector<DictionaryEntry> fonts;
      const Value profile = daemon_.platform().fontManager.profileFontsInfo();
      if (const Dictionary* entries = profile.asDictionary()) {
        for (const auto& [path, record] : entries->entries())
          if (paths.contains(path)) fonts.emplace_back(path, record);
      }
      everyone_ = message(Value::dictionary({{"fontsInfo", Value(Dictionary(std::move(fonts)))}}),
                          urls, true);
    }
  }
  connection.sendShared(everyone_, errorLine(kProfileFontsSite));
}

}  // namespace typhora
