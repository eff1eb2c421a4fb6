#include "view_service_command.h"

#include <chrono>
#include <iostream>
#include <iterator>
#include <optional>

#include "ipc/interface_descriptions.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/linux/lumo/lumo_endpoint.h"
#include "platform/value/json_codec.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl view-service --controller NAME [--answer JSON-ARRAY]\n"
    "                               [--choose FAMILY=PROVIDER]... [--print]\n"
    "\n"
    "Plays the font-install view service: reads the user info (JSON) from standard input,\n"
    "connects to the endpoint passed as descriptor 3 and calls doneWithMissingFonts: with the\n"
    "answer (default []; null for none). Each --choose adds the user's choice of PROVIDER for\n"
    "the disabled family FAMILY to the answer. --print prints the user info as one JSON line\n"
    "first.\n";

// The descriptor the daemon hands the endpoint over on.
constexpr int kEndpointFd = 3;
constexpr std::chrono::seconds kSendTimeout{30};

struct Options {
  std::string controller;
  Value answer = Value(ValueArray{});
  bool print = false;
};

// Parses the arguments; nullopt after saying what is wrong.
std::optional<Options> parse(const std::vector<std::string>& args) {
  Options options;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const bool hasValue = i + 1 < args.size();
    if (args[i] == "--print") {
      options.print = true;
    } else if (args[i] == "--choose" && hasValue) {
      const std::string choice = args[++i];
      const std::size_t equals = choice.find('=');
      if (equals == std::string::npos || options.answer.asArray() == nullptr) {
        std::cerr << "typhoractl: --choose takes FAMILY=PROVIDER\n";
        return std::nullopt;
      }
      ValueArray answer = *options.answer.asArray();
      answer.push_back(Value::dictionary({{"installProvider", choice.substr(equals + 1)},
                                          {"uniqueID", choice.substr(0, equals)}}));
      options.answer = Value(std::move(answer));
    } else if (args[i] == "--controller" && hasValue) {
      options.controller = args[++i];
    } else if (args[i] == "--answer" && hasValue) {
      std::string error;
      auto answer = JsonCodec::decode(args[++i], {}, &error);
      if (!answer || (!answer->isNull() && answer->asArray() == nullptr)) {
        std::cerr << "typhoractl: --answer must be a JSON array" << (error.empty() ? "" : ": ")
                  << error << "\n";
        return std::nullopt;
      }
      options.answer = std::move(*answer);
    } else {
      std::cerr << "typhoractl: unexpected argument '" << args[i] << "'\n" << kUsage;
      return std::nullopt;
    }
  }
  if (options.controller.empty()) {
    std::cerr << "typhoractl: --controller is required\n" << kUsage;
    return std::nullopt;
  }
  return options;
}

std::optional<Value> readUserInfo() {
  const std::string text{std::istreambuf_iterator<char>(std::cin), {}};
  std::string error;
  auto userInfo = JsonCodec::decode(text, {}, &error);
  if (!userInfo) std::cerr << "typhoractl: the user info is not JSON: " << error << "\n";
  return userInfo;
}

bool answer(const Value& doneWith) {
  std::string error;
  auto endpoint = LumoEndpoint::inherited(kEndpointFd, &error);
  if (!endpoint) {
    std::cerr << "typhoractl: " << error << "\n";
    return false;
  }
  auto connection = LumoConnection::toEndpoint(endpoint);
  connection->setRemoteInterface(fontInstallViewServiceProtocol());
  connection->resume();
  bool failed = false;
  connection
      ->synchronousRemoteObjectProxy([&](const std::string& why) {
        std::cerr << "typhoractl: " << why << "\n";
        failed = true;
      })
      ->call(op::kDoneWithMissingFonts, {doneWith});
  // The call is one-way: the connection may close only once it is written.
  if (!failed && !connection->waitUntilSent(kSendTimeout)) {
    std::cerr << "typhoractl: the answer could not be sent\n";
    failed = true;
  }
  connection->invalidate();
  return !failed;
}

}  // namespace

int runViewServiceCommand(const std::vector<std::string>& args) {
  for (const std::string& arg : args) {
    if (arg == "--help" || arg == "-h") {
      std::cout << kUsage;
      return 0;
    }
  }
  auto options = parse(args);
  if (!options) return 2;
  auto userInfo = readUserInfo();
  if (!userInfo) return 1;
  if (options->print) std::cout << JsonCodec::encode(*userInfo) << std::endl;
  return answer(options->answer) ? 0 : 1;
}

}  // namespace typhora::ctl
