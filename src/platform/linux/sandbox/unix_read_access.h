// Whether a user may read a file by the permission bits alone: every directory on the way must
// grant search and the file itself read, to its owner, group or others. Root may read anything
// that exists. Access control lists are not looked at.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace typhora {

struct UnixCredentials {
  uid_t uid = 0;
  std::vector<gid_t> groups;  // the primary group and the supplementary ones

  // The credentials of a running process from /proc; uid and primary group as given.
  static UnixCredentials ofProcess(pid_t pid, uid_t uid, gid_t gid);
};

bool mayRead(const UnixCredentials& who, const std::string& machinePath);

}  // namespace typhora
