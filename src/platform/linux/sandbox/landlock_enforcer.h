// Puts the calling process (and every process it becomes or starts) under a Landlock policy:
// no new privileges first, then the ruleset. Irreversible.
#pragma once

#include <string>

#include "platform/linux/sandbox/landlock_policy.h"

namespace typhora {

class LandlockEnforcer {
 public:
  // False, with `error`, when the kernel refuses any step; the process may then be partly
  // restricted (no new privileges) and must not go on to run the application.
  static bool enforce(const LandlockPolicy& policy, const std::string& deviceRoot,
                      std::string* error);

 private:
  static bool addRule(int ruleset, int rootFd, const LandlockRule& rule, std::string* error);
};

}  // namespace typhora
