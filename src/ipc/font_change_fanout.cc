// Font changes reported by the registry: the cache is dropped, every checked-in handler tells its
// client what it may see of the change, and the change is announced system-wide.
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

constexpr const char* kFontChangedName = "fontChanged";
constexpr const char* kReceived = "received fontChanged notification.";
constexpr const char* kInvalidPath = "got invalid font path: %@";
constexpr const char* kLumoError = "lumo error: %s - %@";
constexpr const char* kUserFontsSite = "-[TyphoraHandler fontChanged:]_block_invoke";
constexpr const char* kProfileFontsSite = "-[TyphoraHandler fontChanged:]_block_invoke_2";

Value stringList(const std::vector<std::string>& strings) {
  return Value(ValueArray(strings.begin(), strings.end()));
}

}  // namespace

void TyphoraDaemon::fontChanged(const Value& change, const IpcReply& reply) {
  TYLog_Debug(kTYLogTyphoraDaemon, kReceived);
  mainHandlerQueue().async([self = shared_from_this(), change] {
    self->invalidateUserFonts();
    self->localNotificationCenter().post(kFontChangedName, change);
    self->platform_.systemNotify.post(FontProviderDidChangeDistributedNotification);
  });
  reply({});
}

void TyphoraHandler::observeFontChanges() {
  std::weak_ptr<TyphoraHandler> weak = weak_from_this();
  server_->localNotificationCenter().addObserver(this, kFontChangedName,
                                                 [weak](const Value& change) {
                                                   if (auto handler = weak.lock())
                                                     handler->fontChanged(change);
                                                 });
}

void TyphoraHandler::fontChanged(const Value& change) {
  TY_ASSERT_ON_QUEUE(server_->mainHandlerQueue());
  const bool added = PlistNumber::boolValue(change.get("added")).value_or(false);
  const std::int64_t kind = PlistNumber::integerValue(change.get("kind")).value_or(0);
  const ValueArray* urls = change.get("urls").asArray();
  const ValueArray none;
  if (kind == 0) {
    userFontsChanged(added, urls != nullptr ? *urls : none);
  } else {
    profileFontsChanged(added, urls != nullptr ? *urls : none);
  }
}

void TyphoraHandler::userFontsChanged(bool added, const ValueArray& urls) {
  const bool enumeration = hasEnumerationEntitlement();
  const bool provider = isFontProvider();
  if (!enumeration && !provider) return;
  std::set<std::string> paths;
  std::vector<std::string> taken;
  std::optional<std::string> directory;
  bool askedForDirectory = false;
  for (const Value& item : urls) {
    const std::string* url = item.asString();
    std::optional<std::string> path = url != nullptr ? FontUrl::path(*url) : std::nullopt;
    if (!path) continue;
    if (added && !isFontFilePath(*path) && !isFontAssetPath(*path)) {
      TYLog_Error(kTYLogTyphoraDaemon, kInvalidPath, *path);
      continue;
    }
    if (added && !enumeration) {
      if (!askedForDirectory) {
        std::optional<std::string> identifier = processIdentifier();
        if (identifier)
          directory = server_->platform().fontManager.directoryNameFromIdentifier(*identifier);
        askedForDirectory = directory.has_value();
      }
      if (!directory || containingDirectoryName(*path) != *directory) continue;
    }
    taken.push_back(*url);
    paths.insert(*path);
  }
  if (paths.empty()) return;

  std::vector<DictionaryEntry> info;
  if (added) {
    std::shared_ptr<IpcConnection> connection = clientConnection();
    const AuditToken token = connection ? connection->auditToken() : AuditToken{};
    std::optional<std::string> found;
    info.emplace_back("fontsInfo",
                      server_->fontInfoForAuditToken(token, enumeration, provider,
                                                     processIdentifier(), paths, &found));
    if (found) {
      Value extension = server_->sandboxExtensionForProvider(token, *found);
      if (!extension.isNull()) info.emplace_back("extension.provider", extension);
    }
  }
  std::shared_ptr<IpcConnection> connection = clientConnection();
  if (!connection) return;
  connection
      ->remoteObjectProxy(
          [](const std::string& error) { SystemLog(kLumoError, kUserFontsSite, error); })
      ->call(op::kFontAddedInfo,
             {Value(Dictionary(std::move(info))), added ? stringList(taken) : Value(),
              added ? Value() : stringList(taken)});
}

void TyphoraHandler::profileFontsChanged(bool added, const ValueArray& urls) {
  std::shared_ptr<IpcConnection> connection = clientConnection();
  std::shared_ptr<IpcRemoteProxy> proxy;
  if (connection) {
    proxy = connection->remoteObjectProxy(
        [](const std::string& error) { SystemLog(kLumoError, kProfileFontsSite, error); });
  }
  std::vector<std::string> taken;
  std::set<std::string> paths;
  for (const Value& item : urls) {
    const std::string* url = item.asString();
    std::optional<std::string> path = url != nullptr ? FontUrl::path(*url) : std::nullopt;
    if (!path) continue;
    taken.push_back(*url);
    paths.insert(*path);
  }
  if (!proxy) return;  // the client has gone: the message is lost
  if (!added) {
    proxy->call(op::kFontAddedInfo, {Value(), Value(), stringList(taken)});
    return;
  }
  std::vector<DictionaryEntry> fonts;
  const Value profile = server_->platform().fontManager.profileFontsInfo();
  if (const Dictionary* entries = profile.asDictionary()) {
    for (const auto& [path, record] : entries->entries())
      if (paths.contains(path)) fonts.emplace_back(path, record);
  }
  proxy->call(op::kFontAddedInfo,
              {Value::dictionary({{"fontsInfo", Value(Dictionary(std::move(fonts)))}}),
               stringList(taken), Value()});
}

}  // namespace typhora
