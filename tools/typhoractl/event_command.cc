#include "event_command.h"

#include <charconv>
#include <iostream>

#include "notification_printer.h"
#include "platform/linux/events/event_socket_protocol.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/json_codec.h"

namespace typhora::ctl {

namespace {

constexpr const char* kEventUsage =
    "usage: typhoractl event post --distributed NAME [USERINFO-JSON]\n"
    "       typhoractl event post --system NAME\n"
    "       typhoractl event watch [--count N]\n"
    "\n"
    "post   posts a notification on the daemon's event socket (root or the daemon's user only)\n"
    "watch  prints every notification posted, one JSON object per line:\n"
    "       {\"kind\": \"distributed\"|\"system\", \"name\": ..., \"userInfo\": ...};\n"
    "       with --count, exits after N of them\n";

constexpr const char* kActivityUsage =
    "usage: typhoractl activity run IDENTIFIER\n"
    "\n"
    "Runs one of the daemon's registered background activities now.\n";

}  // namespace

std::shared_ptr<IpcConnection> connectToEvents(LumoService& service,
                                               std::shared_ptr<IpcExportedObject> exported) {
  auto connection = service.connectToService(kEventSocketName);
  connection->setRemoteInterface(eventSocketProtocol());
  if (exported) {
    connection->setExportedInterface(eventWatcherProtocol());
    connection->setExportedObject(std::move(exported));
  }
  connection->resume();
  return connection;
}

std::optional<std::vector<Value>> callEvents(IpcConnection& connection, const std::string& wireName,
                                             std::vector<Value> arguments) {
  std::optional<std::vector<Value>> reply;
  std::string error;
  connection.synchronousRemoteObjectProxy([&error](const std::string& e) { error = e; })
      ->call(wireName, std::move(arguments),
             [&reply](std::vector<Value> r) { reply = std::move(r); });
  if (!reply) std::cerr << "typhoractl: " << (error.empty() ? "no reply" : error) << "\n";
  return reply;
}

namespace {

int post(const ClientOptions& options, const std::vector<std::string>& args) {
  const bool distributed = args.size() >= 2 && args[0] == "--distributed" && args.size() <= 3;
  const bool system = args.size() == 2 && args[0] == "--system";
  if (!distributed && !system) {
    std::cerr << kEventUsage;
    return 2;
  }
  Value userInfo;
  if (args.size() == 3) {
    std::string error;
    std::optional<Value> parsed = JsonCodec::decode(args[2], {}, &error);
    if (!parsed || parsed->asDictionary() == nullptr) {
      std::cerr << "typhoractl: the user info must be a JSON object" << (parsed ? "" : ": " + error)
                << "\n";
      return 2;
    }
    userInfo = *parsed;
  }
  LumoService service(options.runtimeDir);
  auto connection = connectToEvents(service, nullptr);
  auto reply = distributed
                   ? callEvents(*connection, eventop::kPostDistributedNotification,
                                {Value(args[1]), userInfo})
                   : callEvents(*connection, eventop::kPostSystemNotification, {Value(args[1])});
  connection->invalidate();
  return reply ? 0 : 1;
}

int watch(const ClientOptions& options, const std::vector<std::string>& args) {
  long count = 0;
  if (args.size() == 2 && args[0] == "--count") {
    auto [end, error] = std::from_chars(args[1].data(), args[1].data() + args[1].size(), count);
    if (error != std::errc() || end != args[1].data() + args[1].size() || count <= 0) count = -1;
  }
  if ((!args.empty() && args.size() != 2) || count < 0) {
    std::cerr << kEventUsage;
    return 2;
  }
  LumoService service(options.runtimeDir);
  auto printer = std::make_shared<NotificationPrinter>(count);
  auto connection = connectToEvents(service, printer);
  connection->setInvalidationHandler([printer] { printer->done().signal(); });
  if (!callEvents(*connection, eventop::kWatchNotifications, {})) return 1;
  std::cerr << "typhoractl: watching" << std::endl;
  printer->done().wait();
  connection->invalidate();
  return 0;
}

}  // namespace

int runEventCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  if (args.empty() || args[0] == "--help" || args[0] == "-h") {
    std::cout << kEventUsage;
    return args.empty() ? 2 : 0;
  }
  if (args[0] == "post") return post(options, {args.begin() + 1, args.end()});
  if (args[0] == "watch") return watch(options, {args.begin() + 1, args.end()});
  std::cerr << kEventUsage;
  return 2;
}

int runActivityCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  if (args.empty() || args[0] == "--help" || args[0] == "-h") {
    std::cout << kActivityUsage;
    return args.empty() ? 2 : 0;
  }
  if (args.size() != 2 || args[0] != "run") {
    std::cerr << kActivityUsage;
    return 2;
  }
  LumoService service(options.runtimeDir);
  auto connection = connectToEvents(service, nullptr);
  auto reply = callEvents(*connection, eventop::kRunActivity, {Value(args[1])});
  connection->invalidate();
  if (!reply) return 1;
  if (reply->at(0).asBool() != true) {
    std::cerr << "typhoractl: no activity " << args[1] << " is registered\n";
    return 1;
  }
  std::cout << "{}\n";
  return 0;
}

}  // namespace typhora::ctl
