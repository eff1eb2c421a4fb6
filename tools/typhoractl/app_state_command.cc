#include "app_state_command.h"

#include <charconv>
#include <iostream>
#include <optional>

#include "platform/linux/identity/linux_app_state_monitor.h"

namespace typhora::ctl {

namespace {

constexpr const char* kUsage =
    "usage: typhoractl [--root DIR] app-state set PID STATE\n"
    "       typhoractl [--root DIR] app-state clear PID\n"
    "       typhoractl [--root DIR] app-state show PID\n"
    "\n"
    "Records the application state of a running process (8: running in the foreground) in the\n"
    "platform's table under the device root, or removes it. `show` prints the state the daemon\n"
    "would see: {\"pid\": PID, \"state\": STATE}.\n";

bool parseNumber(const std::string& text, int* value) {
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), *value);
  return error == std::errc() && end == text.data() + text.size();
}

}  // namespace

int runAppStateCommand(const std::string& root, const std::vector<std::string>& args) {
  if (args.empty() || args[0] == "--help" || args[0] == "-h") {
    std::cout << kUsage;
    return args.empty() ? 2 : 0;
  }
  int pid = 0;
  int state = 0;
  bool hasPid = args.size() >= 2 && parseNumber(args[1], &pid);
  bool hasState = args.size() == 3 && parseNumber(args[2], &state);
  LinuxAppStateMonitor states(root);
  std::string error;
  bool ok = false;
  if (args[0] == "set" && hasPid && hasState) {
    ok = states.setState(pid, state, &error);
  } else if (args[0] == "clear" && hasPid && args.size() == 2) {
    ok = states.setState(pid, std::nullopt, &error);
  } else if (args[0] == "show" && hasPid && args.size() == 2) {
    std::cout << "{\"pid\": " << pid << ", \"state\": " << states.mostElevatedApplicationState(pid)
              << "}\n";
    return 0;
  } else {
    std::cerr << kUsage;
    return 2;
  }
  if (!ok) std::cerr << "typhoractl: app-state: " << error << "\n";
  return ok ? 0 : 1;
}

}  // namespace typhora::ctl
