#include "support/log_capture.h"

namespace typhora::testing {

class LogCapture::Sink final : public LogSink {
 public:
  void write(LogLevel level, const LogCategory* category, std::string_view message) override {
    std::lock_guard lock(mutex);
    const LogPeer* peer = currentLogPeer();
    lines.push_back({level, category ? category->category : "system", std::string(message),
                     peer ? peer->pid : 0, peer ? peer->identifier : std::string()});
  }
  mutable std::mutex mutex;
  std::vector<LogLine> lines;
};

LogCapture::LogCapture() : sink_(std::make_shared<Sink>()), previousLevel_(logLevel()) {
  previous_ = setLogSink(sink_);
  setLogLevel(LogLevel::Debug);
}

LogCapture::~LogCapture() {
  setLogSink(previous_);
  setLogLevel(previousLevel_);
}

std::vector<LogLine> LogCapture::lines() const {
  std::lock_guard lock(sink_->mutex);
  return sink_->lines;
}

std::size_t LogCapture::count(const std::string& message) const {
  std::size_t n = 0;
  for (const auto& line : lines()) n += line.message == message ? 1 : 0;
  return n;
}

bool LogCapture::contains(const std::string& substring) const {
  for (const auto& line : lines()) {
    if (line.message.find(substring) != std::string::npos) return true;
  }
  return false;
}

}  // namespace typhora::testing
