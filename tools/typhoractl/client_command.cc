#include "client_command.h"

#include <unistd.h>

#include <cstdlib>
#include <iostream>
#include <memory>

#include "ipc/interface_descriptions.h"
#include "notification_printer.h"
#include "platform/value/json_codec.h"
#include "service_session.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl [--runtime-dir DIR] updating-user-fonts\n"
    "       typhoractl [--runtime-dir DIR] call [--unchecked] OPERATION [JSON-ARGUMENT...]\n"
    "       typhoractl [--runtime-dir DIR] client [--watch] [--count N]\n"
    "\n"
    "updating-user-fonts  waits until the daemon has finished every pending update of the\n"
    "                     user-fonts information; prints {}\n"
    "call                 calls an operation of the service by its wire name (for example\n"
    "                     'updatingUserFonts:') with JSON arguments and prints the reply as a\n"
    "                     JSON array. --unchecked sends it even when the service does not\n"
    "                     describe it, with whatever arguments are given.\n"
    "client               checks in as the application this program is signed as and prints the\n"
    "                     reply as one JSON line ({\"event\": \"checkin\", ...}); with --watch,\n"
    "                     stays checked in and prints each font change the daemon reports\n"
    "                     ({\"event\": \"fontsChanged\", \"added\"|\"removed\": [URL...], "
    "\"info\": ...}),\n"
    "                     until N changes (--count) or for ever.\n";

// An interface describing just `wireName` with untyped arguments, to send what the user typed.
std::shared_ptr<const IpcInterface> uncheckedInterface(const std::string& wireName,
                                                       std::size_t argumentCount) {
  IpcOperation operation{
      wireName, std::vector<IpcType>(argumentCount, IpcType{IpcType::Kind::Any, true}), true, {}};
  return std::make_shared<const IpcInterface>("unchecked", std::vector<IpcOperation>{operation});
}

CallResult callService(const ClientOptions& options, std::shared_ptr<const IpcInterface> remote,
                       const std::string& wireName, std::vector<Value> arguments) {
  return ServiceSession(options, std::move(remote)).call(wireName, std::move(arguments));
}

int call(const ClientOptions& options, std::vector<std::string> args) {
  bool unchecked = false;
  if (!args.empty() && args[0] == "--unchecked") {
    unchecked = true;
    args.erase(args.begin());
  }
  if (args.empty()) {
    std::cerr << kUsage;
    return 2;
  }
  const std::string wireName = args[0];
  std::vector<Value> arguments;
  for (std::size_t i = 1; i < args.size(); ++i) {
    std::string error;
    auto value = JsonCodec::decode(args[i], {}, &error);
    if (!value) {
      std::cerr << "typhoractl: argument " << i << " is not JSON: " << error << "\n";
      return 2;
    }
    arguments.push_back(std::move(*value));
  }
  auto remote = typhoraDaemonProtocol();
  if (unchecked) {
    remote = uncheckedInterface(wireName, arguments.size());
  } else if (remote->find(wireName) == nullptr) {
    std::cerr << "typhoractl: the service has no operation '" << wireName
              << "' (use --unchecked to send it anyway)\n";
    return 2;
  }
  return printCall(callService(options, remote, wireName, std::move(arguments)));
}

// What the daemon tells a checked-in client of a font change
// (fontAddedInfo:addedURLStrings:removedURLStrings:), as one line.
Value fontChange(const std::vector<Value>& arguments) {
  std::vector<DictionaryEntry> fields{{"event", "fontsChanged"}};
  if (!arguments[1].isNull()) fields.emplace_back("added", arguments[1]);
  if (!arguments[2].isNull()) fields.emplace_back("removed", arguments[2]);
  if (!arguments[0].isNull()) fields.emplace_back("info", arguments[0]);
  return Value(Dictionary(std::move(fields)));
}

// Checks in and, watching, prints the font changes the daemon reports on the same connection.
int checkedInClient(const ClientOptions& options, const std::vector<std::string>& args) {
  bool watch = false;
  long count = 0;
  for (std::size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "--watch") {
      watch = true;
    } else if (args[i] == "--count" && i + 1 < args.size()) {
      count = std::atol(args[++i].c_str());
    } else {
      std::cerr << "typhoractl: unexpected argument '" << args[i] << "'\n" << kUsage;
      return 2;
    }
  }
  auto printer = std::make_shared<NotificationPrinter>(count, fontChange);
  ServiceSession session(options, typhoraDaemonProtocol(), printer);
  CallResult checkin = session.call(op::kCheckin, {});
  if (!checkin.ok) return printCall(checkin);
  std::cout << JsonCodec::encode(Value::dictionary(
                   {{"event", "checkin"},
                    {"pid", static_cast<std::int64_t>(getpid())},
                    {"reply", checkin.reply.empty() ? Value() : checkin.reply[0]}}))
            << std::endl;
  if (watch) printer->done().wait();
  return 0;
}

}  // namespace

int runClientCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  if (args.empty()) {
    std::cerr << kUsage;
    return 2;
  }
  const std::string& command = args[0];
  std::vector<std::string> rest(args.begin() + 1, args.end());
  if (!rest.empty() && (rest[0] == "--help" || rest[0] == "-h")) {
    std::cout << kUsage;
    return 0;
  }
  if (command == "updating-user-fonts") {
    CallResult result = callService(options, typhoraDaemonProtocol(), op::kUpdatingUserFonts, {});
    if (!result.ok) return printCall(result);
    std::cout << "{}\n";
    return 0;
  }
  if (command == "call") return call(options, rest);
  if (command == "client") return checkedInClient(options, rest);
  std::cerr << "typhoractl: unknown command '" << command << "'\n" << kUsage;
  return 2;
}

}  // namespace typhora::ctl
