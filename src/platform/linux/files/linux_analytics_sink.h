// Analytics events as one JSON line each, appended to <root>/var/log/typhora/analytics.jsonl:
//   {"date": {"$date": "..."}, "event": {...}, "name": "..."}
// The sink wants events unless <root>/etc/typhora/analytics.plist says {"enabled": false};
// an unwanted event's dictionary is never built.
#pragma once

#include <mutex>
#include <string>

#include "platform/dispatch/clock.h"
#include "platform/services/analytics_sink.h"

namespace typhora {

class LinuxAnalyticsSink final : public AnalyticsSink {
 public:
  LinuxAnalyticsSink(const std::string& root, Clock& clock);
  void sendEvent(const std::string& name, const Builder& builder) override;
  const std::string& logPath() const { return path_; }

 private:
  std::string path_;
  bool enabled_ = true;
  Clock& clock_;
  std::mutex mutex_;  // one line at a time
};

}  // namespace typhora
