#include "status_command.h"

#include <cstdio>
#include <iostream>
#include <sstream>

#include "event_command.h"
#include "metrics_text.h"
#include "platform/value/json_codec.h"
#include "platform/linux/events/event_socket_protocol.h"
#include "platform/value/plist_number.h"

namespace typhora::ctl {
namespace {

constexpr const char* kStatusUsage =
    "usage: typhoractl status [--table | --metrics]\n"
    "\n"
    "The daemon's state, asked on its event socket (root or the daemon's user only): uptime,\n"
    "connections with their pid, signing identifier and capabilities, checked-in clients,\n"
    "web-content connections, the font-request gate, the user-fonts cache and its generation,\n"
    "pending deletions with their due dates, the block list's size and each queue's depth.\n"
    "JSON by default; --table: readable columns; --metrics: Prometheus text exposition.\n";
constexpr const char* kGrantsUsage =
    "usage: typhoractl grants [APP] [--table]\n"
    "\n"
    "The fonts the daemon issued to each application (or to APP), their paths expanded, as a\n"
    "JSON object from application identifier to paths; --table: one line a path.\n";

std::optional<Value> ask(const ClientOptions& options, const char* operation,
                         std::vector<Value> arguments) {
  LumoService service(options.runtimeDir);
  auto connection = connectToEvents(service, nullptr);
  auto reply = callEvents(*connection, operation, std::move(arguments));
  connection->invalidate();
  if (!reply || reply->empty()) return std::nullopt;
  return reply->front();
}

std::string text(const Value& value) {
  if (const std::string* string = value.asString()) return *string;
  if (value.isNull()) return "-";
  return JsonCodec::encode(value);
}

std::string number(const Value& value) {
  if (std::optional<double> real = value.asDouble()) {
    char buffer[32];
    std::snprintf(buffer, sizeof buffer, "%.6g", *real);
    return buffer;
  }
  return text(value);
}

std::string capabilities(const Value& record) {
  std::string names;
  for (const char* name : {"enumeration", "fontAccess", "provider"}) {
    if (record.get(name).asBool() != true) continue;
    if (!names.empty()) names += ',';
    names += name;
  }
  return names.empty() ? "-" : names;
}

void printRow(std::ostream& out, const std::vector<std::string>& cells,
              const std::vector<int>& widths) {
  for (std::size_t i = 0; i < cells.size(); ++i) {
    out << cells[i];
    if (i + 1 < cells.size())
      out << std::string(std::max<int>(1, widths[i] - static_cast<int>(cells[i].size()) + 2), ' ');
  }
  out << "\n";
}

void printStatusTable(const Value& status) {
  std::cout << "typhorad pid " << number(status.get("pid")) << ", up "
            << number(status.get("uptimeSeconds")) << " s\n"
            << "checked-in clients " << number(status.get("checkedInClients"))
            << ", web-content connections " << number(status.get("webContentConnections"))
            << ", font requests at the gate " << number(status.get("requestGate").get("waiting"))
            << "\n"
            << "user-fonts cache "
            << (status.get("userFontsCache").get("loaded").asBool() == true ? "loaded" : "empty")
            << ", generation " << number(status.get("userFontsCache").get("generation"))
            << "; block list entries " << number(status.get("blockListEntries")) << "\n\n";
  const std::vector<int> widths{7, 6, 32, 10, 28};
  printRow(std::cout, {"PID", "UID", "IDENTIFIER", "CHECKEDIN", "CAPABILITIES", "WEBCONTENT"},
           widths);
  if (const ValueArray* connections = status.get("connections").asArray()) {
    for (const Value& c : *connections)
      printRow(std::cout,
               {number(c.get("pid")), number(c.get("uid")), text(c.get("identifier")),
                c.get("checkedIn").asBool() == true ? "yes" : "no",
                capabilities(c.get("capabilities")), number(c.get("webContentConnections"))},
               widths);
  }
  std::cout << "\n";
  printRow(std::cout, {"PENDING DELETION", "DUE (s since 1970)"}, {72});
  if (const ValueArray* pending = status.get("pendingDeletions").asArray()) {
    for (const Value& p : *pending)
      printRow(std::cout, {text(p.get("path")), number(p.get("due"))}, {72});
  }
  std::cout << "\n";
  printRow(std::cout, {"QUEUE", "DEPTH"}, {40});
  if (const ValueArray* queues = status.get("queues").asArray()) {
    for (const Value& q : *queues)
      printRow(std::cout, {text(q.get("label")), number(q.get("depth"))}, {40});
  }
}

}  // namespace

int runStatusCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  const std::string format = args.empty() ? "" : args[0];
  if (args.size() > 1 || (!format.empty() && format != "--table" && format != "--metrics")) {
    const bool help = format == "--help" || format == "-h";
    (help ? std::cout : std::cerr) << kStatusUsage;
    return help ? 0 : 2;
  }
  std::optional<Value> status = ask(options, eventop::kStatusReport, {});
  if (!status) return 1;
  if (format == "--table") {
    printStatusTable(*status);
  } else if (format == "--metrics") {
    std::cout << MetricsText::fromStatus(*status);
  } else {
    std::cout << JsonCodec::encode(*status) << "\n";
  }
  return 0;
}

int runGrantsCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  bool table = false;
  Value application;
  for (const std::string& arg : args) {
    if (arg == "--help" || arg == "-h") {
      std::cout << kGrantsUsage;
      return 0;
    }
    if (arg == "--table") {
      table = true;
    } else if (application.isNull() && !arg.starts_with("-")) {
      application = Value(arg);
    } else {
      std::cerr << kGrantsUsage;
      return 2;
    }
  }
  std::optional<Value> grants = ask(options, eventop::kGrantsReport, {application});
  if (!grants) return 1;
  if (!table) {
    std::cout << JsonCodec::encode(*grants) << "\n";
    return 0;
  }
  const std::vector<int> widths{36};
  printRow(std::cout, {"APPLICATION", "PATH"}, widths);
  if (const Dictionary* entries = grants->asDictionary()) {
    for (const auto& [identifier, paths] : entries->entries()) {
      if (const ValueArray* list = paths.asArray())
        for (const Value& path : *list) printRow(std::cout, {identifier, text(path)}, widths);
    }
  }
  return 0;
}

}  // namespace typhora::ctl
