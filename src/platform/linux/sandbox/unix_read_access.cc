#include "platform/linux/sandbox/unix_read_access.h"

#include <sys/stat.h>

#include <algorithm>
#include <sstream>

#include "platform/linux/identity/process_identity.h"

namespace typhora {

UnixCredentials UnixCredentials::ofProcess(pid_t pid, uid_t uid, gid_t gid) {
  UnixCredentials credentials{uid, {gid}};
  std::istringstream status(ProcessIdentity::readProcessFile(pid, "status").value_or(""));
  std::string line;
  while (std::getline(status, line)) {
    if (!line.starts_with("Groups:")) continue;
    std::istringstream groups(line.substr(7));
    for (gid_t group = 0; groups >> group;) credentials.groups.push_back(group);
    break;
  }
  return credentials;
}

namespace {

// The permission bits of `info` that apply to `who`: owner, else group, else others.
mode_t bitsFor(const UnixCredentials& who, const struct stat& info) {
  if (info.st_uid == who.uid) return (info.st_mode >> 6) & 7;
  if (std::find(who.groups.begin(), who.groups.end(), info.st_gid) != who.groups.end())
    return (info.st_mode >> 3) & 7;
  return info.st_mode & 7;
}

}  // namespace

bool mayRead(const UnixCredentials& who, const std::string& machinePath) {
  if (machinePath.empty() || machinePath.front() != '/') return false;
  struct stat info {};
  if (stat(machinePath.c_str(), &info) != 0) return false;
  if (who.uid == 0) return true;
  if ((bitsFor(who, info) & 4) == 0) return false;
  for (std::size_t slash = machinePath.find('/', 1); slash != std::string::npos;
       slash = machinePath.find('/', slash + 1)) {
    struct stat directory {};
    if (stat(machinePath.substr(0, slash).c_str(), &directory) != 0) return false;
    if ((bitsFor(who, directory) & 1) == 0) return false;
  }
  struct stat top {};
  return stat("/", &top) == 0 && (bitsFor(who, top) & 1) != 0;
}

}  // namespace typhora
