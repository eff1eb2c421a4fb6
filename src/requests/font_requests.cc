// Font requests by name: the entitlement test, the process-wide gate, the resolution of the
// names, the first answer, and the dialog's completion that enables the chosen providers' files.
#include <atomic>
#include <map>
#include <set>

#include "access/user_fonts_entitlement.h"
#include "catalog/font_record.h"
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"

namespace typhora {

namespace {

constexpr const char* kNotEntitled =
    "Application \"%@\" does not have an entitlement to use custom fonts.";
constexpr const char* kBlockedAtGate =
    "Previous SVFontManagerRequestFonts call has not been resolved.  This call from \"%@\" is "
    "blocked until the previous call is acknowledged by the user.";
constexpr const char* kTooManyWaiting =
    "requestFonts: %u requests already wait; the call from \"%@\" is refused.";
constexpr const char* kRequestFontsLog = "requestFonts -  %@";
constexpr const char* kFileUrlScheme = "file://";

std::vector<std::string> keysOf(const Value& dictionary) {
  std::vector<std::string> keys;
  for (const auto& entry : dictionary.asDictionary()->entries()) keys.push_back(entry.first);
  return keys;
}

// The chosen families of a dialog answer, each with the provider chosen for it (or none).
std::map<std::string, std::optional<std::string>> providerChoices(const ValueArray& answer) {
  std::map<std::string, std::optional<std::string>> choices;
  for (const Value& element : answer) {
    const std::string* family = element.get("uniqueID").asString();
    if (family == nullptr) continue;
    const std::string* provider = element.get("installProvider").asString();
    choices[*family] = provider != nullptr ? std::optional(*provider) : std::nullopt;
  }
  return choices;
}

}  // namespace

void TyphoraDaemon::requestFonts(const ValueArray& requests, const IpcReply& reply) {
  RequestFontsCaller caller;
  caller.token = currentAuditToken();
  std::optional<CodeSigningRecord> record = platform_.codeSigning.codeSigningRecord(caller.token);
  const UserFontsEntitlement entitlement =
      record ? UserFontsEntitlement::of(*record) : UserFontsEntitlement{};
  const std::optional<std::string> identifier = record ? record->signingIdentifier() : std::nullopt;
  if ((!entitlement.enumeration && !entitlement.appUsage) || !identifier) {
    SystemLog(kNotEntitled, identifier ? Value(*identifier) : Value());
    reply({Value(Dictionary())});
    return;
  }
  caller.identifier = *identifier;
  caller.enumeration = entitlement.enumeration;

  const std::uint64_t before = requestFontsGate_.arrive();
  if (before >= RequestFontsGate::kWaitingLimit) {
    requestFontsGate_.leave();
    SystemLog(kTooManyWaiting, before, caller.identifier);
    reply({Value(Dictionary())});
    return;
  }
  if (before != 0) SystemLog(kBlockedAtGate, caller.identifier);
  std::weak_ptr<IpcConnection> connection = IpcConnection::current();
  std::weak_ptr<TyphoraDaemon> weak = weak_from_this();
  requestFontsGate_.acquire([weak, requests, caller, connection, reply] {
    if (auto self = weak.lock()) self->admitRequestFonts(requests, caller, connection, reply);
  });
}

void TyphoraDaemon::admitRequestFonts(const ValueArray& requests, const RequestFontsCaller& caller,
                                      const std::weak_ptr<IpcConnection>& connection,
                                      const IpcReply& reply) {
  // A caller that went away while it waited has nobody to answer: its request is dropped.
  auto client = connection.lock();
  if (!client || !client->isValid()) {
    releaseRequestFontsGate(Duration::zero());
    return;
  }
  TYLog_Debug(kTYLogTyphoraDaemon, kRequestFontsLog, Value(requests));
  // Admission may run on the thread releasing the previous request: the resolution is queued
  // rather than run here.
  std::weak_ptr<TyphoraDaemon> weak = weak_from_this();
  mainHandlerQueue().async([weak, requests, caller, reply] {
    if (auto self = weak.lock()) self->resolveRequestFonts(requests, caller, reply);
  });
}

void TyphoraDaemon::resolveRequestFonts(const ValueArray& requests,
                                        const RequestFontsCaller& caller, const IpcReply& reply) {
  TY_ASSERT_ON_QUEUE(mainHandlerQueue());
  std::vector<std::string> enabled;
  std::vector<std::string> disabled;
  const std::vector<std::string> unknown =
      unknownFontNamesAndEnabledFamilyNames(&enabled, &disabled, requests);
  const std::set<std::string> enabledSet(enabled.begin(), enabled.end());
  const Value firstAnswer = filterUserFontInfoForAuditToken(
      caller.token, caller.enumeration,
      [&enabledSet](const std::string&, const Value& record, bool*) {
        return !FontRecord::isDisabled(record) && FontRecord::sharesFamily(record, enabledSet);
      });
  analyticsEventRequestFonts(caller.identifier, unknown.size(), disabled.size(), enabledSet.size());

  const bool missed = !unknown.empty() || !disabled.empty();
  if (!missed) {
    reply({firstAnswer});
    recordIssuedFontPaths(keysOf(firstAnswer), caller.identifier);
    releaseRequestFontsGate(kRequestFontsGateDelay);
  } else {
    ValueArray items = missingFontsDialogRequestsFromUnknownFontNames(unknown);
    for (Value& item : missingFontsDialogRequestsFromDisabledFamilyNames(disabled))
      items.push_back(std::move(item));
    // The view service may answer twice or go away: only the first way out completes.
    auto completed = std::make_shared<std::atomic<bool>>(false);
    std::weak_ptr<TyphoraDaemon> weak = weak_from_this();
    showDialog(items, caller.token.pid,
               [weak, caller, firstAnswer, reply, completed](const ValueArray& answer) {
                 auto self = weak.lock();
                 if (!self || completed->exchange(true)) return;
                 if (self->mainHandlerQueue().isCurrent()) {
                   self->completeRequestFonts(caller, firstAnswer, answer, reply);
                   return;
                 }
                 // Answers arrive on the view service's connection, or on the I/O thread when
                 // the view service ended: the work they start belongs on the daemon's queue.
                 self->mainHandlerQueue().async([self, caller, firstAnswer, answer, reply] {
                   self->completeRequestFonts(caller, firstAnswer, answer, reply);
                 });
               });
  }
  recordRequestFontsResultWihtMissed(missed, !enabledSet.empty());
}

void TyphoraDaemon::completeRequestFonts(const RequestFontsCaller& caller, const Value& firstAnswer,
                                         const ValueArray& answer, const IpcReply& reply) {
  std::vector<DictionaryEntry> finalAnswer = firstAnswer.asDictionary()->entries();
  std::vector<std::string> urlsToEnable;
  if (!answer.empty()) {
    const auto choices = providerChoices(answer);
    std::set<std::string> chosen;
    for (const auto& [family, provider] : choices) chosen.insert(family);
    Value accepted = filterUserFontInfoForAuditToken(
        caller.token, caller.enumeration, [&](const std::string& path, const Value& record, bool*) {
          if (!FontRecord::isDisabled(record) || !FontRecord::sharesFamily(record, chosen))
            return false;
          const std::optional<std::string> provider = identifierFromFilePath(path);
          for (const std::string& family : FontRecord::familyNames(record)) {
            auto choice = choices.find(family);
            if (choice == choices.end() || !choice->second || choice->second != provider) continue;
            urlsToEnable.push_back(kFileUrlScheme + path);
            return true;
          }
          return false;
        });
    for (const auto& entry : accepted.asDictionary()->entries()) finalAnswer.push_back(entry);
  }
  // Dictionary keeps the last entry of a repeated path: a chosen entry replaces the first one.
  const Value result(Dictionary(std::move(finalAnswer)));
  reply({result});
  if (!urlsToEnable.empty()) {
    platform_.fontManager.enableOrDisablePersistentURLs(urlsToEnable, true);
    invalidateUserFonts();
  }
  recordIssuedFontPaths(keysOf(result), caller.identifier);
  releaseRequestFontsGate(kRequestFontsGateDelay);
}

void TyphoraDaemon::releaseRequestFontsGate(Duration after) {
  std::weak_ptr<TyphoraDaemon> weak = weak_from_this();
  auto release = [weak] {
    if (auto self = weak.lock()) self->requestFontsGate_.release();
  };
  if (after == Duration::zero()) {
    platform_.mainQueue.async(release);
  } else {
    platform_.mainQueue.asyncAfter(after, release);
  }
}

}  // namespace typhora
