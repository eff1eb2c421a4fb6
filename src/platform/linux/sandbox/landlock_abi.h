// The kernel's Landlock interface as far as the sandbox uses it. Debian 12's kernel headers stop
// at the first ABI; what later kernels added (truncation, device ioctls, TCP rules, scoping, the
// larger ruleset attribute) is defined here from the kernel's stable ABI, each only if absent.
#pragma once

#include <linux/landlock.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdint>

#ifndef __NR_landlock_create_ruleset  // x86-64 and every architecture with the common table
#define __NR_landlock_create_ruleset 444
#define __NR_landlock_add_rule 445
#define __NR_landlock_restrict_self 446
#endif
#ifndef LANDLOCK_ACCESS_FS_REFER
#define LANDLOCK_ACCESS_FS_REFER (1ULL << 13)  // ABI 2
#endif
#ifndef LANDLOCK_ACCESS_FS_TRUNCATE
#define LANDLOCK_ACCESS_FS_TRUNCATE (1ULL << 14)  // ABI 3
#endif
#ifndef LANDLOCK_ACCESS_FS_IOCTL_DEV
#define LANDLOCK_ACCESS_FS_IOCTL_DEV (1ULL << 15)  // ABI 5
#endif
#ifndef LANDLOCK_ACCESS_NET_BIND_TCP
#define LANDLOCK_ACCESS_NET_BIND_TCP (1ULL << 0)  // ABI 4
#define LANDLOCK_ACCESS_NET_CONNECT_TCP (1ULL << 1)
#endif
#ifndef LANDLOCK_SCOPE_ABSTRACT_UNIX_SOCKET
#define LANDLOCK_SCOPE_ABSTRACT_UNIX_SOCKET (1ULL << 0)  // ABI 6
#define LANDLOCK_SCOPE_SIGNAL (1ULL << 1)
#endif

namespace typhora::landlock {

// The ruleset attribute of ABI 6 and later; the kernel takes its size and reads only what the
// running ABI knows, so a shorter prefix is passed to older kernels.
struct RulesetAttr {
  std::uint64_t handledAccessFs = 0;
  std::uint64_t handledAccessNet = 0;
  std::uint64_t scoped = 0;
};

inline long createRuleset(const RulesetAttr* attr, std::size_t size, std::uint32_t flags) {
  return syscall(__NR_landlock_create_ruleset, attr, size, flags);
}

inline long addPathRule(int rulesetFd, std::uint64_t allowed, int parentFd) {
  landlock_path_beneath_attr rule{};
  rule.allowed_access = allowed;
  rule.parent_fd = parentFd;
  return syscall(__NR_landlock_add_rule, rulesetFd, LANDLOCK_RULE_PATH_BENEATH, &rule, 0U);
}

inline long restrictSelf(int rulesetFd) {
  return syscall(__NR_landlock_restrict_self, rulesetFd, 0U);
}

// The highest ABI the running kernel offers; -1 with errno (ENOSYS, EOPNOTSUPP) without Landlock.
inline int abiVersion() {
  return static_cast<int>(createRuleset(nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION));
}

}  // namespace typhora::landlock
