// The attacks of a torture run. Each runs until its deadline and says how many tries it made
// and, for the attacks that must be refused, how many got through.
#pragma once

#include <chrono>
#include <functional>
#include <string>
#include <vector>

namespace typhora::torture {

struct AttackContext {
  std::string socket;
  std::string self;  // this program, for the child processes some attacks start
  int storm = 1000;  // connections opened at once
  // A command that asks for fonts as an entitled foreground application (so the request gate is
  // held and the missing-fonts dialog comes up); killed at random moments. Empty: none.
  std::vector<std::string> requester;
  // A command that checks in as an application holding fonts and prints its tokens (as
  // `sandbox-open --checkin` does): the token the sandbox-socket attacks replay. Empty: none.
  std::vector<std::string> tokenApp;
  std::chrono::steady_clock::time_point until;
};

struct AttackOutcome {
  long tries = 0;
  long gotThrough = 0;  // tries the daemon should have refused but served
  std::string note;
};

struct Attack {
  std::string name;
  std::function<AttackOutcome(const AttackContext&)> run;
};

std::vector<Attack> allAttacks();
AttackOutcome tokenAttacks(const AttackContext& c);

// The child processes the attacks start (`typhora-torture --child MODE SOCKET [ARG]`); the exit
// status is 0 when the daemon refused, 1 when it answered, 2 when the child could not attack.
int runChild(const std::string& mode, const std::string& socket, const std::string& arg);

}  // namespace typhora::torture
