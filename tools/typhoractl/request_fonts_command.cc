#include "request_fonts_command.h"

#include <chrono>
#include <iostream>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/value/json_codec.h"
#include "service_session.h"

namespace typhora::ctl {
namespace {

constexpr const char* kUsage =
    "usage: typhoractl request-fonts [--family NAME]... [--postscript NAME]...\n"
    "\n"
    "Asks the daemon for fonts by family or PostScript name (requestFonts:reply:), as the\n"
    "application this program is signed as. Prints {\"fonts\": <reply>, \"seconds\": <time from\n"
    "the call to its answer: the wait at the gate, and for the user's choice in the dialog>,\n"
    "\"answeredAt\": <when the answer came, in seconds since the epoch>}.\n";

}  // namespace

int runRequestFontsCommand(const ClientOptions& options, const std::vector<std::string>& args) {
  ValueArray requests;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const bool hasValue = i + 1 < args.size();
    if (args[i] == "--help" || args[i] == "-h") {
      std::cout << kUsage;
      return 0;
    }
    if (args[i] == "--family" && hasValue) {
      requests.push_back(Value::dictionary({{kSVFontFamilyNameAttribute, args[++i]}}));
    } else if (args[i] == "--postscript" && hasValue) {
      requests.push_back(Value::dictionary({{kSVFontNameAttribute, args[++i]}}));
    } else {
      std::cerr << "typhoractl: unexpected argument '" << args[i] << "'\n" << kUsage;
      return 2;
    }
  }
  ServiceSession session(options, typhoraDaemonProtocol());
  const auto start = std::chrono::steady_clock::now();
  CallResult result = session.call(op::kRequestFonts, {Value(std::move(requests))});
  const std::chrono::duration<double> waited = std::chrono::steady_clock::now() - start;
  const std::chrono::duration<double> answeredAt =
      std::chrono::system_clock::now().time_since_epoch();
  if (!result.ok || result.reply.empty()) return printCall(result);
  std::cout << JsonCodec::encode(Value::dictionary({{"answeredAt", answeredAt.count()},
                                                    {"fonts", result.reply[0]},
                                                    {"seconds", waited.count()}}))
            << "\n";
  return 0;
}

}  // namespace typhora::ctl
