// Captures log lines for the lifetime of the object, at every level, so tests can assert the
// exact texts. Restores the previous sink and level afterwards.
#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/log/log.h"

namespace typhora::testing {

struct LogLine {
  LogLevel level;
  std::string category;  // "system" for the plain system log
  std::string message;
  std::int64_t peerPid = 0;  // the thread's log peer when the line was written, if any
  std::string peerIdentifier;
};

class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<LogLine> lines() const;
  // How many lines have exactly this message.
  std::size_t count(const std::string& message) const;
  bool contains(const std::string& substring) const;

 private:
  class Sink;
  std::shared_ptr<Sink> sink_;
  std::shared_ptr<LogSink> previous_;
  LogLevel previousLevel_;
};

}  // namespace typhora::testing
