// What the daemon is doing and what it granted, for the platform's operators. Every part is read
// under its own lock from the calling thread; no queue is waited for.
#include <unistd.h>

#include <algorithm>

#include "daemon/typhora_daemon.h"
#include "ipc/typhora_handler.h"
#include "platform/value/plist_number.h"

namespace typhora {

namespace {

constexpr const char* kIssuesKey = "issues";
constexpr const char* kDeleteKey = "delete";

std::int64_t count(std::size_t n) {
  return static_cast<std::int64_t>(n);
}

std::size_t elementsOf(const Value& value) {
  if (const ValueArray* array = value.asArray()) return array->size();
  if (const Dictionary* dictionary = value.asDictionary()) return dictionary->size();
  return 0;
}

Value pendingDeletions(const Value& table) {
  ValueArray pending;
  if (const Dictionary* entries = table.asDictionary()) {
    for (const auto& [path, due] : entries->entries()) {
      const std::optional<Date> date = due.asDate();
      pending.push_back(Value::dictionary(
          {{"path", path}, {"due", date ? Value(date->secondsSince1970) : Value()}}));
    }
  }
  return Value(std::move(pending));
}

Value queueDepth(const SerialQueue& queue) {
  return Value::dictionary({{"label", queue.label()}, {"depth", count(queue.pendingJobs())}});
}

}  // namespace

Value TyphoraDaemon::statusReport() {
  ValueArray connections;
  std::int64_t checkedIn = 0;
  std::int64_t webContent = 0;
  for (const auto& handler : liveHandlers()) {
    Value record = handler->statusRecord();
    checkedIn += record.get("checkedIn").asBool() == true ? 1 : 0;
    webContent += PlistNumber::integerValue(record.get("webContentConnections")).value_or(0);
    connections.push_back(std::move(record));
  }
  const std::chrono::duration<double> uptime = std::chrono::steady_clock::now() - startedAt_;
  ValueArray queues{queueDepth(SerialQueue::main()), queueDepth(mainHandlerQueue()),
                    queueDepth(updateQueue()), queueDepth(scheduledFontDeletionQueue()),
                    queueDepth(assetHandlerQueue())};
  return Value::dictionary({
      {"pid", static_cast<std::int64_t>(getpid())},
      {"uptimeSeconds", uptime.count()},
      {"connections", Value(std::move(connections))},
      {"checkedInClients", checkedIn},
      {"webContentConnections", webContent},
      {"requestGate", Value::dictionary({{"waiting", count(requestFontsGate_.waiting())}})},
      {"userFontsCache", Value::dictionary({{"loaded", isUserFontsInfoCached()},
                                            {"generation", count(userFontsGeneration())}})},
      {"pendingDeletions", pendingDeletions(platform_.preferences.value(kDeleteKey))},
      {"blockListEntries", count(elementsOf(blacklistInfo()))},
      {"queues", Value(std::move(queues))},
  });
}

Value TyphoraDaemon::grantsReport(const std::optional<std::string>& identifier) {
  std::vector<std::string> identifiers;
  if (const Dictionary* issues = platform_.preferences.value(kIssuesKey).asDictionary()) {
    for (const auto& [name, paths] : issues->entries())
      if (!identifier || name == *identifier) identifiers.push_back(name);
  }
  std::sort(identifiers.begin(), identifiers.end());
  std::vector<DictionaryEntry> grants;
  for (const std::string& name : identifiers) {
    const std::vector<std::string> paths = issuedFontFilePathsForIdentifier(name);
    grants.emplace_back(name, Value(ValueArray(paths.begin(), paths.end())));
  }
  return Value(Dictionary(std::move(grants)));
}

}  // namespace typhora
