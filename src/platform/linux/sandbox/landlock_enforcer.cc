#include "platform/linux/sandbox/landlock_enforcer.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "platform/fd/unique_fd.h"
#include "platform/linux/sandbox/landlock_abi.h"
#include "platform/linux/sandbox/rooted_open.h"

namespace typhora {
namespace {

std::string failure(const std::string& what) {
  return what + ": " + std::strerror(errno);
}

// The attribute's size the ABI reads: a kernel before the network rights (4) or scopes (6)
// refuses a larger one with non-zero fields it does not know.
std::size_t attributeSize(int abi) {
  if (abi >= 6) return sizeof(landlock::RulesetAttr);
  if (abi >= 4) return offsetof(landlock::RulesetAttr, scoped);
  return offsetof(landlock::RulesetAttr, handledAccessNet);
}

}  // namespace

bool LandlockEnforcer::addRule(int ruleset, int rootFd, const LandlockRule& rule,
                               std::string* error) {
  UniqueFd target = rule.beneathDeviceRoot
                        ? openBeneathRoot(rootFd, rule.path, O_PATH | O_CLOEXEC, 0)
                        : UniqueFd(open(rule.path.c_str(), O_PATH | O_CLOEXEC));
  // A path that does not exist grants nothing; the application simply cannot read it.
  if (!target.valid()) {
    if (errno == ENOENT || errno == ENOTDIR) return true;
    *error = failure("cannot open " + rule.path);
    return false;
  }
  struct stat info {};
  if (fstat(target.get(), &info) != 0) {
    *error = failure("cannot inspect " + rule.path);
    return false;
  }
  const std::uint64_t access =
      S_ISDIR(info.st_mode) ? rule.access : LandlockPolicy::forFile(rule.access);
  if (access == 0) return true;
  if (landlock::addPathRule(ruleset, access, target.get()) != 0) {
    *error = failure("Landlock refused the rule for " + rule.path);
    return false;
  }
  return true;
}

bool LandlockEnforcer::enforce(const LandlockPolicy& policy, const std::string& deviceRoot,
                               std::string* error) {
  // First: the ruleset needs it, and nothing after this may gain privileges by an exec.
  if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) {
    *error = failure("cannot set no-new-privileges");
    return false;
  }
  landlock::RulesetAttr attr{policy.handledFs(), policy.handledNet(), policy.scoped()};
  UniqueFd ruleset(
      static_cast<int>(landlock::createRuleset(&attr, attributeSize(policy.abi()), 0)));
  if (!ruleset.valid()) {
    *error = failure("cannot create a Landlock ruleset");
    return false;
  }
  UniqueFd root(open(deviceRoot.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!root.valid()) {
    *error = failure("cannot open the device root " + deviceRoot);
    return false;
  }
  for (const LandlockRule& rule : policy.rules()) {
    if (!addRule(ruleset.get(), root.get(), rule, error)) return false;
  }
  if (landlock::restrictSelf(ruleset.get()) != 0) {
    *error = failure("Landlock refused to restrict the process");
    return false;
  }
  return true;
}

}  // namespace typhora
