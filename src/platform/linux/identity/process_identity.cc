#include "platform/linux/identity/process_identity.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <sstream>

#include "platform/fd/unique_fd.h"

namespace typhora {
namespace {

std::optional<std::uint64_t> startTimeOf(pid_t pid) {
  std::optional<std::string> content = ProcessIdentity::readProcessFile(pid, "stat");
  if (!content) return std::nullopt;
  // The command name may hold spaces and parentheses: fields start after the last ')'.
  std::size_t close = content->rfind(')');
  if (close == std::string::npos || close + 2 > content->size()) return std::nullopt;
  std::istringstream fields(content->substr(close + 2));
  std::string field;
  // Field 3 (state) is the first after the name; the start time is field 22.
  for (int index = 3; fields >> field; ++index) {
    if (index != 22) continue;
    std::uint64_t start = 0;
    auto [end, error] = std::from_chars(field.data(), field.data() + field.size(), start);
    if (error != std::errc() || end != field.data() + field.size()) return std::nullopt;
    return start;
  }
  return std::nullopt;
}

bool executableOf(pid_t pid, std::uint64_t* device, std::uint64_t* inode) {
  struct stat info {};
  if (stat(("/proc/" + std::to_string(pid) + "/exe").c_str(), &info) != 0) return false;
  *device = info.st_dev;
  *inode = info.st_ino;
  return true;
}

}  // namespace

std::optional<std::uint64_t> ProcessIdentity::startTime(pid_t pid) {
  return startTimeOf(pid);
}

std::optional<std::string> ProcessIdentity::readProcessFile(pid_t pid, const char* name) {
  // Plain reads: a process that ends while its file is read makes the read fail (ESRCH), which
  // must be an answer here, never an exception.
  UniqueFd fd(open(("/proc/" + std::to_string(pid) + "/" + name).c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return std::nullopt;
  std::string content;
  char buffer[4096];
  for (;;) {
    ssize_t n = read(fd.get(), buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return std::nullopt;
    if (n == 0) return content;
    content.append(buffer, static_cast<std::size_t>(n));
  }
}

AuditToken ProcessIdentity::ofProcess(pid_t pid, uid_t uid, gid_t gid) {
  AuditToken token;
  auto start = pid > 0 ? startTimeOf(pid) : std::nullopt;
  if (!start) return token;
  token.pid = pid;
  token.uid = uid;
  token.gid = gid;
  token.startTime = *start;
  if (!executableOf(pid, &token.exeDevice, &token.exeInode)) return AuditToken{};
  // The process may have gone and its pid been reused between the two reads.
  if (startTimeOf(pid) != start) return AuditToken{};
  return token;
}

AuditToken ProcessIdentity::ofSocketPeer(int fd) {
  ucred cred{};
  socklen_t length = sizeof cred;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0 || cred.pid <= 0) {
    return AuditToken{};
  }
  return ofProcess(cred.pid, cred.uid, cred.gid);
}

bool ProcessIdentity::isValid(const AuditToken& token) {
  if (token.isZero()) return false;
  if (startTimeOf(token.pid) != token.startTime) return false;
  std::uint64_t device = 0;
  std::uint64_t inode = 0;
  if (!executableOf(token.pid, &device, &inode)) return false;
  return device == token.exeDevice && inode == token.exeInode &&
         startTimeOf(token.pid) == token.startTime;
}

std::optional<std::string> ProcessIdentity::executablePath(const AuditToken& token) {
  if (!isValid(token)) return std::nullopt;
  char buffer[4096];
  ssize_t n =
      readlink(("/proc/" + std::to_string(token.pid) + "/exe").c_str(), buffer, sizeof buffer - 1);
  if (n <= 0 || !isValid(token)) return std::nullopt;
  return std::string(buffer, static_cast<std::size_t>(n));
}

}  // namespace typhora
