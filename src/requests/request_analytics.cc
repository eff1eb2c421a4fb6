// What font requests found: one analytics event per request, and two persistent counters
// collected for periodic reporting.
#include "daemon/typhora_daemon.h"

namespace typhora {

namespace {

constexpr const char* kEventName = "com.zorvane.font-privacy";
constexpr const char* kMissedKey = "missed";
constexpr const char* kResolvedKey = "resolved";

std::uint64_t counter(const PreferencesStore& preferences, const char* key) {
  return preferences.value(key).asUInt().value_or(0);
}

}  // namespace

void TyphoraDaemon::analyticsEventRequestFonts(const std::string& identifier, std::uint64_t misses,
                                               std::uint64_t suggestions, std::uint64_t resolved) {
  platform_.analytics.sendEvent(kEventName, [identifier, misses, suggestions, resolved] {
    return Value::dictionary({{"misses", Value(misses)},
                              {"name", Value(identifier)},
                              {"resolved", Value(resolved)},
                              {"suggestions", Value(suggestions)}});
  });
}

void TyphoraDaemon::recordRequestFontsResultWihtMissed(bool missed, bool andResolved) {
  if (!missed && !andResolved) return;
  std::lock_guard lock(requestCountersMutex_);
  if (missed)
    platform_.preferences.setValue(kMissedKey,
                                   Value(counter(platform_.preferences, kMissedKey) + 1));
  if (andResolved)
    platform_.preferences.setValue(kResolvedKey,
                                   Value(counter(platform_.preferences, kResolvedKey) + 1));
  platform_.preferences.synchronize();
}

void TyphoraDaemon::extractRequestFontsMissed(std::uint64_t* missed, std::uint64_t* andResolved) {
  std::lock_guard lock(requestCountersMutex_);
  const std::uint64_t missedCount = counter(platform_.preferences, kMissedKey);
  const std::uint64_t resolvedCount = counter(platform_.preferences, kResolvedKey);
  if (missedCount != 0 || resolvedCount != 0) {
    platform_.preferences.setValue(kMissedKey, Value(std::uint64_t{0}));
    platform_.preferences.setValue(kResolvedKey, Value(std::uint64_t{0}));
    platform_.preferences.synchronize();
  }
  *missed = missedCount;
  *andResolved = resolvedCount;
}

}  // namespace typhora
