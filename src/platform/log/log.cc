#include "platform/log/log.h"

#include <syslog.h>
#include <systemd/sd-journal.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <ctime>
#include <mutex>

#include "platform/value/plist_number.h"

namespace typhora {
namespace {

std::atomic<LogLevel> minimumLevel{LogLevel::Info};

std::mutex& sinkMutex() {
  static auto* m = new std::mutex();
  return *m;
}
std::shared_ptr<LogSink>& currentSink() {
  static auto* sink = new std::shared_ptr<LogSink>();
  return *sink;
}

const char* levelName(LogLevel level) {
  switch (level) {
    case LogLevel::Debug:
      return "debug";
    case LogLevel::Info:
      return "info";
    case LogLevel::Error:
      return "error";
  }
  return "info";
}

std::string timestamp() {
  auto now = std::chrono::system_clock::now();
  std::time_t seconds = std::chrono::system_clock::to_time_t(now);
  auto millis =
      std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()) % 1000;
  std::tm tm{};
  gmtime_r(&seconds, &tm);
  char buffer[40];
  std::size_t n = std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &tm);
  std::snprintf(buffer + n, sizeof buffer - n, ".%03dZ", static_cast<int>(millis.count()));
  return buffer;
}

class StderrSink final : public LogSink {
 public:
  void write(LogLevel level, const LogCategory* category, std::string_view message) override {
    std::string line = timestamp() + " " + levelName(level) + " ";
    if (category != nullptr) {
      line += std::string(category->subsystem) + ":" + category->category;
    } else {
      line += "system";
    }
    line += " ";
    line += message;
    line += "\n";
    std::fwrite(line.data(), 1, line.size(), stderr);
    std::fflush(stderr);
  }
};

class JournalSink final : public LogSink {
 public:
  void write(LogLevel level, const LogCategory* category, std::string_view message) override {
    int priority = level == LogLevel::Error   ? LOG_ERR
                   : level == LogLevel::Debug ? LOG_DEBUG
                                              : LOG_INFO;
    std::string text(message);
    const char* categoryName = category != nullptr ? category->category : "system";
    const LogPeer* peer = currentLogPeer();
    if (peer == nullptr) {
      sd_journal_send("MESSAGE=%s", text.c_str(), "PRIORITY=%d", priority,
                      "SYSLOG_IDENTIFIER=typhorad", "TYPHORA_CATEGORY=%s", categoryName, nullptr);
    } else if (peer->identifier.empty()) {
      sd_journal_send("MESSAGE=%s", text.c_str(), "PRIORITY=%d", priority,
                      "SYSLOG_IDENTIFIER=typhorad", "TYPHORA_CATEGORY=%s", categoryName,
                      "TYPHORA_PEER_PID=%lld", static_cast<long long>(peer->pid), nullptr);
    } else {
      sd_journal_send("MESSAGE=%s", text.c_str(), "PRIORITY=%d", priority,
                      "SYSLOG_IDENTIFIER=typhorad", "TYPHORA_CATEGORY=%s", categoryName,
                      "TYPHORA_PEER_PID=%lld", static_cast<long long>(peer->pid),
                      "TYPHORA_PEER_IDENTIFIER=%s", peer->identifier.c_str(), nullptr);
    }
  }
};

// Appends one conversion (its letter, after any length modifiers) for `arg`.
void appendConversion(std::string* out, char conversion, const LogArg& arg) {
  const auto& v = arg.value();
  if (conversion == '@' || conversion == 's') {
    if (auto* s = std::get_if<std::string>(&v)) {
      *out += *s;
    } else if (auto* i = std::get_if<std::int64_t>(&v)) {
      *out += std::to_string(*i);
    } else if (auto* u = std::get_if<std::uint64_t>(&v)) {
      *out += std::to_string(*u);
    } else {
      *out += std::to_string(std::get<double>(v));
    }
    return;
  }
  if (auto* i = std::get_if<std::int64_t>(&v)) {
    *out += std::to_string(*i);
  } else if (auto* u = std::get_if<std::uint64_t>(&v)) {
    *out += std::to_string(*u);
  } else if (auto* d = std::get_if<double>(&v)) {
    *out += conversion == 'f' ? std::to_string(*d)
                              : std::to_string(PlistNumber::integerValue(Value(*d)).value_or(0));
  } else {
    *out += std::get<std::string>(v);
  }
}

// Whether the bytes at `i` start a character that must not reach a log line as it is: a C0 or C1
// control or a line or paragraph separator. Answers its length in bytes, or 0.
std::size_t controlAt(std::string_view text, std::size_t i) {
  const auto byte = [&](std::size_t k) {
    return k < text.size() ? static_cast<unsigned char>(text[k]) : 0u;
  };
  const unsigned c = byte(i);
  if (c < 0x20 || c == 0x7f) return 1;
  if (c == 0xc2 && byte(i + 1) >= 0x80 && byte(i + 1) <= 0x9f) return 2;
  if (c == 0xe2 && byte(i + 1) == 0x80 && (byte(i + 2) == 0xa8 || byte(i + 2) == 0xa9)) return 3;
  return 0;
}

void appendEscaped(std::string* out, std::string_view character) {
  char buffer[16];
  if (character.size() == 1) {
    const auto c = static_cast<unsigned char>(character[0]);
    if (c == '\n') {
      *out += "\\n";
    } else if (c == '\r') {
      *out += "\\r";
    } else if (c == '\t') {
      *out += "\\t";
    } else {
      std::snprintf(buffer, sizeof buffer, "\\x%02x", c);
      *out += buffer;
    }
    return;
  }
  const unsigned code = character.size() == 2
                            ? static_cast<unsigned char>(character[1])
                            : 0x2000u + (static_cast<unsigned char>(character[2]) & 0x3fu);
  std::snprintf(buffer, sizeof buffer, "\\u%04x", code);
  *out += buffer;
}

}  // namespace

std::string escapeLogControls(std::string_view message) {
  std::string out;
  std::size_t copied = 0;
  for (std::size_t i = 0; i < message.size();) {
    const std::size_t length = controlAt(message, i);
    if (length == 0) {
      ++i;
      continue;
    }
    if (out.empty()) out.reserve(message.size() + 16);
    out.append(message.substr(copied, i - copied));
    appendEscaped(&out, message.substr(i, length));
    i += length;
    copied = i;
  }
  if (copied == 0) return std::string(message);
  out.append(message.substr(copied));
  return out;
}

std::string formatLog(std::string_view format, std::initializer_list<LogArg> args) {
  std::string out;
  out.reserve(format.size() + 32);
  auto next = args.begin();
  for (std::size_t i = 0; i < format.size(); ++i) {
    char c = format[i];
    if (c != '%' || i + 1 >= format.size()) {
      out += c;
      continue;
    }
    std::size_t j = i + 1;
    if (format[j] == '%') {
      out += '%';
      i = j;
      continue;
    }
    while (j < format.size() && (format[j] == 'l' || format[j] == 'z' || format[j] == 'h')) ++j;
    if (j >= format.size()) {
      out += format.substr(i);
      break;
    }
    char conversion = format[j];
    if (conversion != '@' && conversion != 's' && conversion != 'd' && conversion != 'i' &&
        conversion != 'u' && conversion != 'f') {
      out += format.substr(i, j - i + 1);  // unknown conversions stay as written
      i = j;
      continue;
    }
    if (next == args.end()) {
      out += "(missing)";
    } else {
      appendConversion(&out, conversion, *next++);
    }
    i = j;
  }
  return out;
}

std::shared_ptr<LogSink> setLogSink(std::shared_ptr<LogSink> sink) {
  std::lock_guard lock(sinkMutex());
  return std::exchange(currentSink(), std::move(sink));
}

void setLogLevel(LogLevel level) {
  minimumLevel = level;
}
LogLevel logLevel() {
  return minimumLevel;
}

std::shared_ptr<LogSink> makeStderrLogSink() {
  return std::make_shared<StderrSink>();
}
std::shared_ptr<LogSink> makeJournalLogSink() {
  return std::make_shared<JournalSink>();
}

namespace {
thread_local const LogPeer* threadLogPeer = nullptr;
}  // namespace

LogPeerScope::LogPeerScope(LogPeer peer) : previous_(threadLogPeer), peer_(std::move(peer)) {
  threadLogPeer = &peer_;
}

LogPeerScope::~LogPeerScope() {
  threadLogPeer = previous_;
}

const LogPeer* currentLogPeer() {
  return threadLogPeer;
}

void logWrite(LogLevel level, const LogCategory* category, std::string_view format,
              std::initializer_list<LogArg> args) {
  if (level < minimumLevel.load()) return;
  // Whatever the arguments carry, one call writes one line.
  std::string message = escapeLogControls(formatLog(format, args));
  std::shared_ptr<LogSink> sink;
  {
    std::lock_guard lock(sinkMutex());
    sink = currentSink();
  }
  if (!sink) {
    static auto* fallback = new StderrSink();
    fallback->write(level, category, message);
    return;
  }
  sink->write(level, category, message);
}

}  // namespace typhora
