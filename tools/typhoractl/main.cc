// typhoractl: plays the daemon's peers from the command line and inspects property-list files.
// Prints JSON on standard output, errors on standard error.
#include <csignal>
#include <cstdlib>
#include <iostream>
#include <string>
#include <vector>

#include "app_state_command.h"
#include "client_command.h"
#include "event_command.h"
#include "font_command.h"
#include "font_names_command.h"
#include "font_picker_command.h"
#include "load_command.h"
#include "plist_command.h"
#include "request_fonts_command.h"
#include "sandbox_command.h"
#include "status_command.h"
#include "view_service_command.h"
#include "web_content_command.h"

namespace {

constexpr const char* kUsage =
    "usage: typhoractl [--runtime-dir DIR] [--root DIR] COMMAND [ARGS...]\n"
    "\n"
    "commands:\n"
    "  updating-user-fonts   wait for the daemon's pending user-fonts updates\n"
    "  call OPERATION ...    call any operation of the service, print the reply as JSON\n"
    "  plist show|convert    show or convert property-list files (CBOR or JSON)\n"
    "  app-state set|clear|show   the platform's record of application states\n"
    "  event post|watch      post or watch notifications on the daemon's event socket\n"
    "  activity run ID       run one of the daemon's background activities now\n"
    "  view-service          play the font-install view service an alert starts\n"
    "  load OPERATION ...    many connections calling one operation at once, with latencies\n"
    "  request-fonts         ask for fonts by family or PostScript name, as an application\n"
    "  web-content-app       an application whose web-content processes receive fonts\n"
    "  web-content           a web-content process (started by web-content-app)\n"
    "  picker-client         an application that starts the font picker with its endpoint\n"
    "  pick NAME             the font picker delivering NAME's family to its client\n"
    "  font-names FILE       a font file's PostScript and family names, as JSON\n"
    "  font install|remove|enable|disable|list   the font registry under the device root\n"
    "  client [--watch]      check in as an application; --watch prints font changes\n"
    "  status [--table|--metrics]   the daemon's state (event socket: root or its user)\n"
    "  grants [APP] [--table]       the fonts issued to each application\n"
    "  sandbox-exec [--root DIR] -- PROGRAM ARGS...   run an application in its sandbox\n"
    "  sandbox-open TOKEN [--read]  exchange a sandbox token for a descriptor\n"
    "\n"
    "  --runtime-dir DIR     where the daemon's socket is (default $TYPHORA_RUNTIME_DIR,\n"
    "                        else /run/typhora)\n"
    "  --root DIR            the device root (default $TYPHORA_ROOT, else " TYPHORA_DEFAULT_ROOT
    ")\n"
    "  --version             print the version\n"
    "Each command takes --help.\n";

}  // namespace

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  std::vector<std::string> args(argv + 1, argv + argc);
  typhora::ctl::ClientOptions options;
  const char* fromEnv = std::getenv("TYPHORA_RUNTIME_DIR");
  options.runtimeDir = fromEnv != nullptr ? fromEnv : "/run/typhora";
  const char* rootFromEnv = std::getenv("TYPHORA_ROOT");
  std::string root = rootFromEnv != nullptr ? rootFromEnv : TYPHORA_DEFAULT_ROOT;

  while (!args.empty() && args[0].starts_with("--")) {
    if (args[0] == "--help" || args[0] == "-h") {
      std::cout << kUsage;
      return 0;
    }
    if (args[0] == "--version") {
      std::cout << "typhoractl " TYPHORA_VERSION "\n";
      return 0;
    }
    if (args[0] == "--runtime-dir" && args.size() >= 2) {
      options.runtimeDir = args[1];
      args.erase(args.begin(), args.begin() + 2);
      continue;
    }
    if (args[0] == "--root" && args.size() >= 2) {
      root = args[1];
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
  if (args[0] == "view-service")
    return typhora::ctl::runViewServiceCommand({args.begin() + 1, args.end()});
  if (args[0] == "plist") return typhora::ctl::runPlistCommand({args.begin() + 1, args.end()});
  if (args[0] == "app-state")
    return typhora::ctl::runAppStateCommand(root, {args.begin() + 1, args.end()});
  if (args[0] == "event")
    return typhora::ctl::runEventCommand(options, {args.begin() + 1, args.end()});
  if (args[0] == "load")
    return typhora::ctl::runLoadCommand(options, {args.begin() + 1, args.end()});
  const std::vector<std::string> rest(args.begin() + 1, args.end());
  if (args[0] == "request-fonts") return typhora::ctl::runRequestFontsCommand(options, rest);
  if (args[0] == "web-content-app") return typhora::ctl::runWebContentAppCommand(options, rest);
  if (args[0] == "web-content") return typhora::ctl::runWebContentCommand(rest);
  if (args[0] == "picker-client") return typhora::ctl::runPickerClientCommand(options, rest);
  if (args[0] == "pick") return typhora::ctl::runPickCommand(options, rest);
  if (args[0] == "font-names") return typhora::ctl::runFontNamesCommand(rest);
  if (args[0] == "font") return typhora::ctl::runFontCommand(options, root, rest);
  if (args[0] == "sandbox-exec") return typhora::ctl::runSandboxExecCommand(root, rest);
  if (args[0] == "sandbox-open") return typhora::ctl::runSandboxOpenCommand(options, root, rest);
  if (args[0] == "status") return typhora::ctl::runStatusCommand(options, rest);
  if (args[0] == "grants") return typhora::ctl::runGrantsCommand(options, rest);
  if (args[0] == "activity")
    return typhora::ctl::runActivityCommand(options, {args.begin() + 1, args.end()});
  return typhora::ctl::runClientCommand(options, args);
}
