// One client process of `typhoractl load --clients`: a checked-in connection that keeps calling
// the daemon until its time is up (check-ins, with a font change and a font request now and
// then), counts the font changes it is told of, and reports every latency to its parent.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "client_command.h"
#include "platform/ipc/ipc_connection.h"
#include "platform/value/value.h"

namespace typhora::ctl {

struct LoadPlan {
  int clients = 50;
  double seconds = 60;
  double changeEverySeconds = 5;    // per client; 0: never
  double requestEverySeconds = 60;  // per client; 0: never (requests pass one at a time)
  std::string family = "DejaVu Sans";
  std::string changedUrl =
      "file:///var/mobile/Library/UserFonts/FontFiles/com.example.load/Load.ttf";
};

class LoadWorker {
 public:
  LoadWorker(const ClientOptions& options, const LoadPlan& plan, int index);
  // Runs the calls and writes the report to `fd`: per operation "NAME ERRORS MS MS ...", then
  // "notifications N", then "error TEXT" lines. Returns the process exit status.
  int run(int fd);

 private:
  struct Operation {
    std::vector<double> latencies;
    long errors = 0;
  };
  // Times one call; false when it failed.
  bool timedCall(const std::string& name, const std::string& wireName, std::vector<Value> args);
  void report(int fd, long notifications) const;

  ClientOptions options_;
  LoadPlan plan_;
  int index_;
  std::map<std::string, Operation> operations_;
  std::vector<std::string> errors_;
  std::shared_ptr<IpcConnection> connection_;
};

}  // namespace typhora::ctl
