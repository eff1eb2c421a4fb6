// Logging: the product family's TYLog functions with a category, and plain system-log lines.
//
// Formats are printf-like: "%@" prints a Value's description (a std::string, a C string or any
// object with description() works too), "%s" a string, "%d" a signed and "%u" an unsigned integer,
// "%f" a double, "%%" a percent sign. A conversion with no argument left prints "(missing)"; extra
// arguments are ignored. Lines go to the installed sink (stderr by default) with level and
// category.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>

#include "platform/value/value.h"

namespace typhora {

enum class LogLevel { Debug = 0, Info = 1, Error = 2 };

struct LogCategory {
  const char* subsystem;
  const char* category;
};

// The daemon's one category.
inline constexpr LogCategory kTYLogTyphoraDaemon{"com.zorvane.typhorad", "daemon"};

// The peer that the calling thread's log lines are about: set by a scope around the handling of a
// peer's call. The journal sink records it in TYPHORA_PEER_PID and TYPHORA_PEER_IDENTIFIER.
struct LogPeer {
  std::int64_t pid = 0;
  std::string identifier;  // its signing identifier; empty when it has none
};
class LogPeerScope {
 public:
  explicit LogPeerScope(LogPeer peer);
  ~LogPeerScope();
  LogPeerScope(const LogPeerScope&) = delete;
  LogPeerScope& operator=(const LogPeerScope&) = delete;

 private:
  const LogPeer* previous_;
  LogPeer peer_;
};
// The innermost open scope's peer on this thread, or null.
const LogPeer* currentLogPeer();

// Where formatted lines go. `category` is nullptr for the plain system log.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual void write(LogLevel level, const LogCategory* category, std::string_view message) = 0;
};

// One formatting argument.
class LogArg {
 public:
  LogArg(const Value& v) : v_(v.description()) {}               // NOLINT
  LogArg(const std::string& s) : v_(s) {}                       // NOLINT
  LogArg(std::string_view s) : v_(std::string(s)) {}            // NOLINT
  LogArg(const char* s) : v_(std::string(s ? s : "(null)")) {}  // NOLINT
  LogArg(double d) : v_(d) {}                                   // NOLINT
  template <class T, std::enable_if_t<std::is_integral_v<T>, int> = 0>
  LogArg(T i) {  // NOLINT
    if constexpr (std::is_signed_v<T>) {
      v_ = static_cast<std::int64_t>(i);
    } else {
      v_ = static_cast<std::uint64_t>(i);
    }
  }
  template <class T, class = decltype(std::declval<const T&>().description())>
  LogArg(const T& object) : v_(std::string(object.description())) {}  // NOLINT

  const std::variant<std::string, std::int64_t, std::uint64_t, double>& value() const { return v_; }

 private:
  std::variant<std::string, std::int64_t, std::uint64_t, double> v_;
};

std::string formatLog(std::string_view format, std::initializer_list<LogArg> args);
// `message` with every control character (C0, C1, DEL, line and paragraph separators) written as
// an escape ("\n", "\x1b", "\u0085"), so that it stays one line whatever it quotes.
std::string escapeLogControls(std::string_view message);

// Installs the sink for every later line (nullptr: back to stderr). Returns the previous one.
std::shared_ptr<LogSink> setLogSink(std::shared_ptr<LogSink> sink);
// Lines below `level` are dropped before formatting (default: Info).
void setLogLevel(LogLevel level);
LogLevel logLevel();
// The stderr sink ("<level> <subsystem>:<category> message") and the journal sink.
std::shared_ptr<LogSink> makeStderrLogSink();
std::shared_ptr<LogSink> makeJournalLogSink();

void logWrite(LogLevel level, const LogCategory* category, std::string_view format,
              std::initializer_list<LogArg> args);

template <class... A>
void TYLog(const LogCategory& category, std::string_view format, const A&... args) {
  logWrite(LogLevel::Info, &category, format, {LogArg(args)...});
}
template <class... A>
void TYLog_Debug(const LogCategory& category, std::string_view format, const A&... args) {
  logWrite(LogLevel::Debug, &category, format, {LogArg(args)...});
}
template <class... A>
void TYLog_Error(const LogCategory& category, std::string_view format, const A&... args) {
  logWrite(LogLevel::Error, &category, format, {LogArg(args)...});
}
// A plain line in the system log (refusals, the block list, IPC-level failures).
template <class... A>
void SystemLog(std::string_view format, const A&... args) {
  logWrite(LogLevel::Info, nullptr, format, {LogArg(args)...});
}

}  // namespace typhora
