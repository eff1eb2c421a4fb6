// typhoractl: plays the daemon's peers from the command line and inspects property-list files.
// Prints JSON on standard output, errors on standard error.
#include <csignal>
#include <cstdlib>
#include <iostream>
#include <string>
#include <vector>

#include "client_command.h"
#include "plist_command.h"

namespace {

constexpr const char* kUsage =
    "usage: typhoractl [--runtime-dir DIR] COMMAND [ARGS...]\n"
    "\n"
    "commands:\n"
    "  updating-user-fonts   wait for the daemon's pending user-fonts updates\n"
    "  call OPERATION ...    call any operation of the service, print the reply as JSON\n"
    "  plist show|convert    show or convert property-list files (CBOR or JSON)\n"
    "\n"
    "  --runtime-dir DIR     where the daemon's socket is (default $TYPHORA_RUNTIME_DIR,\n"
    "                        else /run/typhora)\n"
    "Each command takes --help.\n";

}  // namespace

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  std::vector<std::string> args(argv + 1, argv + argc);
  typhora::ctl::ClientOptions options;
  const char* fromEnv = std::getenv("TYPHORA_RUNTIME_DIR");
  options.runtimeDir = fromEnv != nullptr ? fromEnv : "/run/typhora";

  while (!args.empty() && args[0].starts_with("--")) {
    if (args[0] == "--help" || args[0] == "-h") {
      std::cout << kUsage;
      return 0;
    }
    if (args[0] == "--runtime-dir" && args.size() >= 2) {
      options.runtimeDir = args[1];
      args.erase(args.begin(), args.begin() + 2);
      continue;
    }
    std::cerr << "typhoractl: unknown option " << args[0] << "\n" << kUsage;
    return 2;
  }
  if (args.empty()) {
    std::cerr << kUsage;
    return 2;
  }
  if (args[0] == "plist") return typhora::ctl::runPlistCommand({args.begin() + 1, args.end()});
  return typhora::ctl::runClientCommand(options, args);
}
