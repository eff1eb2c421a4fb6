#include "web_content_server.h"

#include <unistd.h>

#include <iostream>

#include "ipc/interface_descriptions.h"
#include "platform/linux/lumo/lumo_connection.h"
#include "platform/value/json_codec.h"

namespace typhora::ctl {
namespace {

// The token texts of a check-in dictionary: its extensions and every font's "data".
ValueArray tokensOf(const Value& checkin) {
  ValueArray tokens;
  auto add = [&tokens](const Value& value) {
    const Bytes* bytes = value.asData();
    if (bytes == nullptr) return;
    std::string text(bytes->begin(), bytes->end());
    if (!text.empty() && text.back() == '\0') text.pop_back();
    tokens.emplace_back(std::move(text));
  };
  for (const char* key : {"extension", "extension.fontasset", "extension.provider"})
    add(checkin.get(key));
  if (const Dictionary* fonts = checkin.get("fontsInfo").asDictionary()) {
    for (const auto& [path, record] : fonts->entries()) add(record.get("data"));
  }
  return tokens;
}

}  // namespace

bool WebContentServer::shouldAcceptNewConnection(IpcListener& /*listener*/,
                                                 std::shared_ptr<IpcConnection> connection) {
  connection->setExportedInterface(typhoraBrisvelSupportServerProtocol());
  connection->setExportedObject(shared_from_this());
  {
    std::lock_guard lock(mutex_);
    connection_ = connection;
  }
  connection->resume();
  return true;
}

bool WebContentServer::invoke(const IpcOperation& operation, const std::vector<Value>& arguments,
                              IpcReply reply) {
  if (operation.wireName == op::kBrisvelPing) {
    reply({Value("pong")});
    return true;
  }
  if (operation.wireName != op::kUserInstalledFontsInfo) return false;
  std::cout << JsonCodec::encode(Value::dictionary({{"role", "web-content"},
                                                    {"pid", getpid()},
                                                    {"received", arguments.at(0)},
                                                    {"tokens", Value(tokensOf(arguments.at(0)))}}))
            << std::endl;
  reply({});
  received_.signal();
  return true;
}

bool WebContentServer::waitForFonts(std::chrono::seconds timeout) {
  if (!received_.waitFor(timeout)) return false;
  std::shared_ptr<IpcConnection> connection;
  {
    std::lock_guard lock(mutex_);
    connection = connection_;
  }
  auto lumo = std::dynamic_pointer_cast<LumoConnection>(connection);
  return lumo == nullptr || lumo->waitUntilSent(timeout);
}

}  // namespace typhora::ctl
