#include "platform/linux/files/linux_analytics_sink.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <filesystem>

#include "platform/fd/unique_fd.h"
#include "platform/linux/files/atomic_file.h"
#include "platform/linux/files/device_root.h"
#include "platform/log/log.h"
#include "platform/value/json_codec.h"
#include "platform/value/plist_reader.h"

namespace typhora {

LinuxAnalyticsSink::LinuxAnalyticsSink(const std::string& root, Clock& clock)
    : path_(DeviceRoot(root).onDisk("/var/log/typhora/analytics.jsonl")), clock_(clock) {
  std::optional<Value> settings =
      PlistReader::readFile(DeviceRoot(root).onDisk("/etc/typhora/analytics.plist"), {}, nullptr);
  if (settings && settings->get("enabled").asBool() == false) enabled_ = false;
}

void LinuxAnalyticsSink::sendEvent(const std::string& name, const Builder& builder) {
  if (!enabled_) return;
  Value record = Value::dictionary({{"date", clock_.now()}, {"event", builder()}, {"name", name}});
  std::string line = JsonCodec::encode(record) + "\n";
  std::lock_guard lock(mutex_);
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path_).parent_path(), ec);
  // One write of the whole line with O_APPEND: lines of concurrent writers never interleave.
  // Only into a regular file: a FIFO in its place neither blocks the open nor takes the line.
  UniqueFd fd(open(path_.c_str(),
                   O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0640));
  struct stat info {};
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(line.data());
  if (!fd.valid() || fstat(fd.get(), &info) != 0 || !S_ISREG(info.st_mode) ||
      !AtomicFile::writeAll(fd.get(), {bytes, line.size()}))
    TYLog_Error(kTYLogTyphoraDaemon, "analytics: cannot append to %@", path_);
}

}  // namespace typhora
