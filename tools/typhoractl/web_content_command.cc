#include "web_content_command.h"

#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <iostream>

#include "child_launcher.h"
#include "endpoint_handoff.h"
#include "ipc/interface_descriptions.h"
#include "platform/fd/unique_fd.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/json_codec.h"
#include "service_session.h"
#include "web_content_server.h"

namespace typhora::ctl {
namespace {

constexpr const char* kAppUsage =
    "usage: typhoractl web-content-app --child PROGRAM [--children N]\n"
    "\n"
    "Plays an application that shows web content: checks in, then N times (default 1) starts\n"
    "PROGRAM as a web-content process ('PROGRAM web-content'; a copy of typhoractl with a\n"
    "manifest of its own), takes the endpoint it hands over and passes it to the daemon with\n"
    "checkinForBrisvelProcess:reply: on the same connection. Prints one JSON line per step; each\n"
    "web-content process prints the fonts and tokens it received.\n";
constexpr const char* kChildUsage =
    "usage: typhoractl web-content\n"
    "\n"
    "Plays a web-content process started by 'web-content-app': hands its endpoint over on\n"
    "descriptor 3, answers the daemon's ping, prints the fonts it receives and exits.\n";
constexpr int kHandoffFd = 3;
constexpr std::chrono::seconds kPatience{30};

void printStep(std::vector<DictionaryEntry> fields) {
  fields.emplace_back("role", "application");
  std::cout << JsonCodec::encode(Value(Dictionary(std::move(fields)))) << std::endl;
}

// Starts one web-content process and has the daemon deliver its fonts; false on failure.
bool startWebContent(ServiceSession& session, const std::string& program) {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, pair) != 0) {
    std::cerr << "typhoractl: socketpair failed\n";
    return false;
  }
  UniqueFd ours(pair[0]);
  UniqueFd theirs(pair[1]);
  std::string error;
  const pid_t child = ChildLauncher::start(program, {"web-content"}, theirs.get(), &error);
  theirs.reset();
  auto endpoint = child > 0 ? EndpointHandoff::receive(ours.get(), &error) : nullptr;
  if (!endpoint) {
    std::cerr << "typhoractl: no web-content endpoint: " << error << "\n";
    if (child > 0) ChildLauncher::wait(child);
    return false;
  }
  const auto start = std::chrono::steady_clock::now();
  CallResult result = session.call(op::kCheckinForBrisvelProcess, {Value(endpoint)});
  const std::chrono::duration<double> waited = std::chrono::steady_clock::now() - start;
  const int status = ChildLauncher::wait(child);
  printStep({{"webContentPid", child},
             {"replied", result.ok},
             {"seconds", waited.count()},
             {"webContentStatus", status}});
  return result.ok && status == 0;
}

}  // namespace

int runWebContentAppCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  std::string program;
  int children = 1;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const bool hasValue = i + 1 < args.size();
    if (args[i] == "--help" || args[i] == "-h") {
      std::cout << kAppUsage;
      return 0;
    }
    if (args[i] == "--child" && hasValue) {
      program = args[++i];
    } else if (args[i] == "--children" && hasValue) {
      children = std::atoi(args[++i].c_str());
    } else {
      std::cerr << "typhoractl: unexpected argument '" << args[i] << "'\n" << kAppUsage;
      return 2;
    }
  }
  if (program.empty() || children < 1) {
    std::cerr << kAppUsage;
    return 2;
  }
  ServiceSession session(options, typhoraDaemonProtocol());
  CallResult checkin = session.call(op::kCheckin, {});
  if (!checkin.ok) return printCall(checkin);
  printStep({{"pid", getpid()}, {"checkin", checkin.reply.empty() ? Value() : checkin.reply[0]}});
  bool ok = true;
  for (int i = 0; i < children; ++i) ok = startWebContent(session, program) && ok;
  return ok ? 0 : 1;
}

int runWebContentCommand(const std::vector<std::string>& args) {
  if (!args.empty()) {
    std::cout << kChildUsage;
    return args[0] == "--help" || args[0] == "-h" ? 0 : 2;
  }
  LumoService service("/nonexistent");
  auto server = std::make_shared<WebContentServer>();
  auto listener = service.makeAnonymousListener();
  std::string error;
  if (!listener) {
    std::cerr << "typhoractl: no listener\n";
    return 1;
  }
  listener->setDelegate(server);
  listener->resume();
  if (!EndpointHandoff::send(kHandoffFd, *listener->endpoint(), &error)) {
    std::cerr << "typhoractl: " << error << "\n";
    return 1;
  }
  close(kHandoffFd);
  const bool received = server->waitForFonts(kPatience);
  listener->invalidate();
  if (!received) std::cerr << "typhoractl: no fonts were delivered\n";
  return received ? 0 : 1;
}

}  // namespace typhora::ctl
