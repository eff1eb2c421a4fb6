#include "font_picker_command.h"

#include <iostream>

#include "child_launcher.h"
#include "font_picker_client.h"
#include "ipc/interface_descriptions.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/json_codec.h"
#include "service_session.h"

namespace typhora::ctl {
namespace {

constexpr const char* kClientUsage =
    "usage: typhoractl picker-client --picker PROGRAM --name POSTSCRIPT-NAME [--refuse|--silent]\n"
    "\n"
    "Plays an application that uses the font picker: offers the font-picker client interface\n"
    "on an endpoint, starts 'PROGRAM pick POSTSCRIPT-NAME' with it as descriptor 3 (PROGRAM is a\n"
    "copy of typhoractl: the picker) and prints the fonts the daemon delivers, answering true\n"
    "(false with --refuse, never with --silent). Exits with the picker's status.\n";
constexpr const char* kPickUsage =
    "usage: typhoractl pick POSTSCRIPT-NAME\n"
    "\n"
    "Plays the font picker: calls requestFonts:forClient:reply: with the name and the client's\n"
    "endpoint (descriptor 3) and prints the reply as a JSON array.\n";
constexpr int kEndpointFd = 3;

}  // namespace

int runPickerClientCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  std::string picker;
  std::string name;
  bool activates = true;
  bool silent = false;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const bool hasValue = i + 1 < args.size();
    if (args[i] == "--help" || args[i] == "-h") {
      std::cout << kClientUsage;
      return 0;
    }
    if (args[i] == "--picker" && hasValue) {
      picker = args[++i];
    } else if (args[i] == "--name" && hasValue) {
      name = args[++i];
    } else if (args[i] == "--refuse") {
      activates = false;
    } else if (args[i] == "--silent") {
      silent = true;
    } else {
      std::cerr << "typhoractl: unexpected argument '" << args[i] << "'\n" << kClientUsage;
      return 2;
    }
  }
  if (picker.empty() || name.empty()) {
    std::cerr << kClientUsage;
    return 2;
  }
  LumoService service(options.runtimeDir);
  auto client = std::make_shared<FontPickerClient>(activates, silent);
  auto listener = service.makeAnonymousListener();
  const auto* endpoint =
      listener ? dynamic_cast<const LumoEndpoint*>(listener->endpoint().get()) : nullptr;
  if (endpoint == nullptr) {
    std::cerr << "typhoractl: no listener\n";
    return 1;
  }
  listener->setDelegate(client);
  listener->resume();
  std::string error;
  const pid_t pid = ChildLauncher::start(
      picker, {"--runtime-dir", options.runtimeDir, "pick", name}, endpoint->fd(), &error);
  if (pid < 0) {
    std::cerr << "typhoractl: " << error << "\n";
    return 1;
  }
  const int status = ChildLauncher::wait(pid);
  listener->invalidate();
  std::cout << JsonCodec::encode(Value::dictionary({{"role", "font-picker-client"},
                                                    {"activations", client->activations()},
                                                    {"pickerStatus", status}}))
            << std::endl;
  return status;
}

int runPickCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  if (args.size() != 1 || args[0] == "--help" || args[0] == "-h") {
    std::cout << kPickUsage;
    return args.size() == 1 ? 0 : 2;
  }
  std::string error;
  auto endpoint = LumoEndpoint::inherited(kEndpointFd, &error);
  if (!endpoint) {
    std::cerr << "typhoractl: " << error << "\n";
    return 1;
  }
  ServiceSession session(options, typhoraDaemonProtocol());
  return printCall(session.call(op::kRequestFontsForClient, {Value(args[0]), Value(endpoint)}));
}

}  // namespace typhora::ctl
