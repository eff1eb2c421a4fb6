#include "client_command.h"

#include <iostream>
#include <memory>

#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "service_session.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl [--runtime-dir DIR] updating-user-fonts\n"
    "       typhoractl [--runtime-dir DIR] call [--unchecked] OPERATION [JSON-ARGUMENT...]\n"
    "\n"
    "updating-user-fonts  waits until the daemon has finished every pending update of the\n"
    "                     user-fonts information; prints {}\n"
    "call                 calls an operation of the service by its wire name (for example\n"
    "                     'updatingUserFonts:') with JSON arguments and prints the reply as a\n"
    "                     JSON array. --unchecked sends it even when the service does not\n"
    "                     describe it, with whatever arguments are given.\n";

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
  std::cerr << "typhoractl: unknown command '" << command << "'\n" << kUsage;
  return 2;
}

}  // namespace typhora::ctl
