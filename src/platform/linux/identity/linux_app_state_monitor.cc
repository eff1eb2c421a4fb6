#include "platform/linux/identity/linux_app_state_monitor.h"

#include <fcntl.h>
#include <sys/file.h>

#include <climits>
#include <cstdlib>
#include <filesystem>
#include <vector>

#include "platform/fd/unique_fd.h"
#include "platform/linux/files/atomic_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/plist_reader.h"

namespace typhora {

namespace {

std::optional<std::uint64_t> startTimeOf(pid_t pid) {
  AuditToken token = ProcessIdentity::ofProcess(pid, 0, 0);
  if (token.isZero()) return std::nullopt;
  return token.startTime;
}

bool isCurrent(pid_t pid, const Value& entry) {
  std::optional<std::uint64_t> recorded = entry.get("startTime").asUInt();
  return recorded && startTimeOf(pid) == recorded;
}

}  // namespace

LinuxAppStateMonitor::LinuxAppStateMonitor(const std::string& root)
    : path_(DeviceRoot(root).onDisk("/var/run/typhora/app-states.plist")) {}

int LinuxAppStateMonitor::mostElevatedApplicationState(pid_t pid) const {
  std::optional<Value> table = PlistReader::readFile(path_, {}, nullptr);
  if (!table) return kApplicationStateUnknown;
  const Value& entry = table->get(std::to_string(pid));
  std::optional<std::int64_t> state = entry.get("state").asInt();
  // A state outside int's range is no state at all (it must not wrap into one).
  if (!state || *state < INT_MIN || *state > INT_MAX || !isCurrent(pid, entry))
    return kApplicationStateUnknown;
  return static_cast<int>(*state);
}

bool LinuxAppStateMonitor::setState(pid_t pid, std::optional<int> state, std::string* error) const {
  std::optional<std::uint64_t> startTime = startTimeOf(pid);
  if (state && !startTime) {
    if (error != nullptr) *error = "no process " + std::to_string(pid);
    return false;
  }
  // Writers take turns on a lock file beside the table; readers need no lock since the table is
  // replaced whole.
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path_).parent_path(), ec);
  UniqueFd lock(open((path_ + ".lock").c_str(),
                     O_RDONLY | O_CREAT | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (lock.valid()) flock(lock.get(), LOCK_EX);

  std::vector<DictionaryEntry> entries;
  if (std::optional<Value> table = PlistReader::readFile(path_, {}, nullptr)) {
    if (const Dictionary* old = table->asDictionary()) {
      for (const auto& [key, entry] : old->entries()) {
        pid_t other = static_cast<pid_t>(std::atoll(key.c_str()));
        if (other != pid && isCurrent(other, entry)) entries.emplace_back(key, entry);
      }
    }
  }
  if (state) {
    entries.emplace_back(std::to_string(pid),
                         Value::dictionary({{"state", *state}, {"startTime", *startTime}}));
  }
  return AtomicFile::write(path_, CborCodec::encode(Value(Dictionary(std::move(entries)))), 0644,
                           error);
}

}  // namespace typhora
