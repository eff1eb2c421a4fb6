#include "view_service_command.h"

#include <fcntl.h>

#include <chrono>
#include <iostream>
#include <iterator>

#include "ipc/interface_descriptions.h"
#include "platform/json_codec.h"
#include "platform/linux/lumo_connection.h"
#include "platform/linux/lumo_endpoint.h"
#include "platform/linux/lumo_service.h"

namespace typhora::ctl {

namespace {

constexpr const char* kUsage =
    "usage: typhoractl view-service --controller NAME [--answer JSON-ARRAY] [--print]\n"
    "\n"
    "Plays the font-install view service as the platform starts it for an alert: the user info\n"
    "arrives as JSON on standard input and the alert's endpoint as descriptor 3. Prints the user\n"
    "info as one JSON line with --print, then answers the missing-fonts controller with\n"
    "doneWithMissingFonts: and the given array (default []), and exits.\n";

constexpr int kEndpointDescriptor = 3;

struct Options {
  std::string controller;
  std::string answer = "[]";
  bool print = false;
};

bool parse(const std::vector<std::string>& args, Options* options) {
  for (std::size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "--print") {
      options->print = true;
    } else if (args[i] == "--controller" && i + 1 < args.size()) {
      options->controller = args[++i];
    } else if (args[i] == "--answer" && i + 1 < args.size()) {
      options->answer = args[++i];
    } else {
      return false;
    }
  }
  return !options->controller.empty();
}

}  // namespace

int runViewServiceCommand(const std::vector<std::string>& args) {
  Options options;
  if (!args.empty() && (args[0] == "--help" || args[0] == "-h")) {
    std::cout << kUsage;
    return 0;
  }
  if (!parse(args, &options)) {
    std::cerr << kUsage;
    return 2;
  }
  std::string error;
  std::optional<Value> answer = JsonCodec::decode(options.answer, {}, &error);
  if (!answer || answer->asArray() == nullptr) {
    std::cerr << "typhoractl: the answer must be a JSON array\n";
    return 2;
  }
  std::string input((std::istreambuf_iterator<char>(std::cin)), std::istreambuf_iterator<char>());
  std::optional<Value> userInfo = JsonCodec::decode(input, {}, &error);
  if (!userInfo) {
    std::cerr << "typhoractl: the user info is not JSON: " << error << "\n";
    return 1;
  }
  if (options.print) std::cout << JsonCodec::encode(*userInfo) << std::endl;
  if (fcntl(kEndpointDescriptor, F_GETFD) < 0) {
    std::cerr << "typhoractl: no endpoint on descriptor 3\n";
    return 1;
  }
  fcntl(kEndpointDescriptor, F_SETFD, FD_CLOEXEC);
  LumoService service("/");
  auto connection = service.connect(std::make_shared<LumoEndpoint>(UniqueFd(kEndpointDescriptor)));
  connection->setRemoteInterface(fontInstallViewServiceProtocol());
  connection->resume();
  bool sent = true;
  connection
      ->remoteObjectProxy([&sent](const std::string& e) {
        sent = false;
        std::cerr << "typhoractl: " << e << "\n";
      })
      ->call(op::kDoneWithMissingFonts, {*answer});
  // A one-way answer: it must have left before the connection closes.
  auto lumo = std::dynamic_pointer_cast<LumoConnection>(connection);
  if (sent && lumo && !lumo->waitUntilSent(std::chrono::seconds(10))) {
    std::cerr << "typhoractl: the answer could not be sent\n";
    sent = false;
  }
  connection->invalidate();
  return sent ? 0 : 1;
}

}  // namespace typhora::ctl
