// Font files deleted on a schedule: a persistent table of due dates in the preference "delete",
// one one-shot timer on the deletion queue, and runs that delete what is (nearly) due.
#include <cmath>
#include <limits>
#include <map>
#include <set>

#include "daemon/paths.h"
#include "daemon/typhora_daemon.h"
#include "platform/log/log.h"
#include "platform/storage/file_system.h"

namespace typhora {

namespace {

constexpr const char* kDeletionQueueLabel = "com.zorvane.typhorad.scheduledFontDeletion";
constexpr const char* kDeleteKey = "delete";
constexpr const char* kDeleteDelayKey = "deleteDelay";
constexpr const char* kInternalSubsystem = "com.zorvane.Typhora";
constexpr std::uint32_t kInternalDelay = 600;
constexpr std::uint32_t kCustomerDelay = 10800;
constexpr double kDueMargin = 180;
constexpr std::uint32_t kNothingPending = std::numeric_limits<std::uint32_t>::max();
constexpr std::chrono::seconds kFireNowLeeway{60};

constexpr const char* kExecute = "executeScheduledFontFilesDeletion";
constexpr const char* kNoFiles = "executeScheduledFontFilesDeletion - no files to delete.";
constexpr const char* kScheduledDeletion = "scheduled deletion: %d";
constexpr const char* kDeletionFailed = "scheduled deletion failed: \"%@\" - %@";
constexpr const char* kNextDeletion = "next deletion after %d seconds.";
constexpr const char* kAllDeleted = "all files deleted.";
constexpr const char* kRefusedPaths =
    "scheduleFontFilesDeletion: refused %u paths, the first \"%@\": %s";
constexpr const char* kDroppedEntries =
    "executeScheduledFontFilesDeletion: dropped %u entries that are not plain paths";

// The pending table stays small: a client cannot grow the daemon's preferences without bound.
constexpr std::size_t kMaxPendingDeletions = 4096;
constexpr std::size_t kMaxPathBytes = 1024;

// Why `path`, a font-file or font-asset path, cannot be scheduled; nullptr when it can.
const char* refusalOf(const std::string& path) {
  if (path.size() > kMaxPathBytes) return "path too long";
  if (!FileSystem::isPlainAbsolutePath(path)) return "not a plain absolute path";
  return nullptr;
}

// Seconds truncated toward zero into 32 bits, saturating.
std::uint32_t truncatedSeconds(double seconds) {
  if (!(seconds > 0)) return 0;
  if (seconds >= 4294967295.0) return kNothingPending;
  return static_cast<std::uint32_t>(seconds);
}

std::vector<DictionaryEntry> tableEntries(const Value& table) {
  const Dictionary* entries = table.asDictionary();
  return entries != nullptr ? entries->entries() : std::vector<DictionaryEntry>{};
}

// Process-wide: made on first use and never released.
const std::shared_ptr<SerialQueue>& deletionQueue() {
  static const std::shared_ptr<SerialQueue> queue = SerialQueue::create(kDeletionQueueLabel);
  return queue;
}

}  // namespace

SerialQueue& TyphoraDaemon::scheduledFontDeletionQueue() {
  return *deletionQueue();
}

std::shared_ptr<OneShotTimer> TyphoraDaemon::scheduledFontDeletionTimer() const {
  return scheduledFontDeletionTimer_;
}

void TyphoraDaemon::scheduleFontFilesDeletion(const std::vector<std::string>& paths) {
  if (paths.empty()) return;
  std::uint32_t delay =
      platform_.buildVariant.isInternalBuild(kInternalSubsystem) ? kInternalDelay : kCustomerDelay;
  if (std::optional<double> configured = platform_.preferences.value(kDeleteDelayKey).asDouble();
      configured && *configured > 0)
    delay = truncatedSeconds(*configured);
  scheduledFontDeletionQueue().async([self = shared_from_this(), paths, delay] {
    self->addPendingDeletions(paths, delay);
    self->setFontFilesDeletionTimer(delay);
  });
}

void TyphoraDaemon::addPendingDeletions(const std::vector<std::string>& paths,
                                        std::uint32_t delay) {
  TY_ASSERT_ON_QUEUE(scheduledFontDeletionQueue());
  std::map<std::string, Value> table;
  for (auto& [path, due] : tableEntries(platform_.preferences.value(kDeleteKey)))
    table.insert_or_assign(path, due);
  const Value due(Date{platform_.clock.now().secondsSince1970 + delay});
  std::size_t refused = 0;
  const std::string* firstRefused = nullptr;
  const char* why = nullptr;
  for (const std::string& path : paths) {
    if (!isFontFilePath(path) && !isFontAssetPath(path)) continue;
    const char* refusal = refusalOf(path);
    if (refusal == nullptr && table.size() >= kMaxPendingDeletions && !table.contains(path))
      refusal = "too many pending deletions";
    if (refusal != nullptr) {
      if (refused++ == 0) {
        firstRefused = &path;
        why = refusal;
      }
      continue;
    }
    table.insert_or_assign(path, due);  // a later entry of the same path wins
  }
  platform_.preferences.setValue(
      kDeleteKey, Value(Dictionary(std::vector<DictionaryEntry>(table.begin(), table.end()))));
  platform_.preferences.synchronize();
  if (refused > 0) SystemLog(kRefusedPaths, refused, *firstRefused, why);
}

void TyphoraDaemon::setFontFilesDeletionTimer(std::uint32_t seconds) {
  scheduledFontDeletionQueue().async([self = shared_from_this(), seconds] {
    const std::chrono::seconds quarter{seconds / 4};
    const std::chrono::seconds start = std::chrono::seconds{seconds} + quarter;
    auto& timer = self->scheduledFontDeletionTimer_;
    if (!timer) {
      std::weak_ptr<TyphoraDaemon> weak = self;
      timer = OneShotTimer::create(deletionQueue(), self->platform_.clock, [weak] {
        if (auto daemon = weak.lock())
          daemon->executeScheduledFontFilesDeletion(daemon->scheduledFontDeletionTimer_);
      });
      timer->schedule(start, quarter);
    } else if (seconds == 0) {
      timer->schedule(Duration::zero(), kFireNowLeeway);
    } else if (timer->state() != OneShotTimer::State::Pending) {
      timer->schedule(start, quarter);
    }  // a pending timer keeps its earlier deadline
  });
}

void TyphoraDaemon::stopFontFilesDeletionTimer() {
  scheduledFontDeletionQueue().async([self = shared_from_this()] {
    if (!self->scheduledFontDeletionTimer_) return;
    self->scheduledFontDeletionTimer_->cancel();
    self->scheduledFontDeletionTimer_.reset();
  });
}

void TyphoraDaemon::executeScheduledFontFilesDeletion(
    const std::shared_ptr<OneShotTimer>& /*timer*/) {
  TY_ASSERT_ON_QUEUE(scheduledFontDeletionQueue());
  TYLog_Debug(kTYLogTyphoraDaemon, kExecute);
  std::vector<DictionaryEntry> table = tableEntries(platform_.preferences.value(kDeleteKey));
  if (table.empty()) {
    TYLog_Error(kTYLogTyphoraDaemon, kNoFiles);
    stopFontFilesDeletionTimer();
    return;
  }
  std::vector<std::string> due;
  std::uint32_t nextDelay = kNothingPending;
  bool changed = false;
  unsigned dropped = 0;
  const double now = platform_.clock.now().secondsSince1970;
  std::erase_if(table, [&](const DictionaryEntry& entry) {
    std::optional<Date> date = entry.second.asDate();
    if (!date || !std::isfinite(date->secondsSince1970) ||
        (!isFontFilePath(entry.first) && !isFontAssetPath(entry.first))) {
      changed = true;
      return true;
    }
    if (refusalOf(entry.first) != nullptr) {  // stored before such paths were refused
      ++dropped;
      changed = true;
      return true;
    }
    const double left = date->secondsSince1970 - now;
    if (left < kDueMargin) {
      due.push_back(entry.first);
      changed = true;
      return true;
    }
    if (left < static_cast<double>(nextDelay)) nextDelay = truncatedSeconds(left);
    return false;
  });
  if (dropped > 0) SystemLog(kDroppedEntries, dropped);
  if (changed) {
    platform_.preferences.setValue(kDeleteKey, Value(Dictionary(std::move(table))));
    platform_.preferences.synchronize();
  }
  if (!due.empty()) removeDueFontFiles(due);
  if (nextDelay != kNothingPending) {
    TYLog_Debug(kTYLogTyphoraDaemon, kNextDeletion, nextDelay);
    setFontFilesDeletionTimer(nextDelay);
  } else {
    TYLog_Debug(kTYLogTyphoraDaemon, kAllDeleted);
    stopFontFilesDeletionTimer();
  }
}

void TyphoraDaemon::removeDueFontFiles(const std::vector<std::string>& due) {
  TYLog_Debug(kTYLogTyphoraDaemon, kScheduledDeletion, due.size());
  std::set<std::string> directories;
  for (const std::string& path : due) {
    // Only directories below the two font directories go when emptied, never those themselves.
    if (const std::string_view directory = parentDirectoryPath(path);
        isFontFilePath(directory) || isFontAssetPath(directory))
      directories.emplace(directory);
    // A mirrored asset file stays while its asset is still installed.
    if (isFontAssetPath(path) &&
        platform_.fileSystem.fileExists(std::string(kAssetStoreDirectory) +
                                        std::string(containingDirectoryName(path))))
      continue;
    std::string error;
    if (!platform_.fileSystem.removeItem(path, &error))
      TYLog_Error(kTYLogTyphoraDaemon, kDeletionFailed, path, error);
  }
  for (const std::string& directory : directories) {
    std::optional<std::vector<std::string>> contents =
        platform_.fileSystem.contentsOfDirectory(directory);
    std::string ignored;
    if (!contents || contents->empty())
      platform_.fileSystem.removeEmptyDirectory(directory, &ignored);
  }
}

void TyphoraDaemon::setupForScheduledFontDeletion() {
  if (!tableEntries(platform_.preferences.value(kDeleteKey)).empty()) setFontFilesDeletionTimer(0);
}

}  // namespace typhora
