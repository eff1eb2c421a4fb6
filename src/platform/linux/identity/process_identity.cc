#include "platform/linux/identity/process_identity.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>

#include "platform/fd/unique_fd.h"
#include "platform/linux/identity/pinned_processes.h"

namespace typhora {
namespace {

// A process's /proc directory, opened once: every file read through it belongs to that process
// instance. Once the process has ended, reads through it fail, even if its pid names another
// process by then, so what is read through one directory never mixes two processes.
class ProcDirectory {
 public:
  explicit ProcDirectory(pid_t pid)
      : owned_(pid > 0 ? open(("/proc/" + std::to_string(pid)).c_str(),
                              O_RDONLY | O_DIRECTORY | O_CLOEXEC)
                       : -1),
        fd_(owned_.get()) {}
  // Reads through a directory held elsewhere (a pinned peer's), opened O_PATH or not.
  static ProcDirectory borrowing(int directory) { return ProcDirectory(directory, Borrowed{}); }

  bool valid() const { return fd_ >= 0; }

  std::optional<std::string> read(const char* name) const {
    // Plain reads: a process that ends while its file is read makes the read fail (ESRCH), which
    // must be an answer here, never an exception.
    UniqueFd file(openat(fd_, name, O_RDONLY | O_CLOEXEC));
    if (!file.valid()) return std::nullopt;
    std::string content;
    char buffer[4096];
    for (;;) {
      ssize_t n = ::read(file.get(), buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) return std::nullopt;
      if (n == 0) return content;
      content.append(buffer, static_cast<std::size_t>(n));
    }
  }

  // Field 22 of stat, the start time in clock ticks since boot.
  std::optional<std::uint64_t> startTime() const {
    std::optional<std::string> stat = read("stat");
    if (!stat) return std::nullopt;
    // The command name may hold spaces and parentheses: fields start after the last ')'.
    std::size_t at = stat->rfind(')');
    if (at == std::string::npos) return std::nullopt;
    at += 2;  // the state, field 3
    for (int field = 3; field < 22; ++field) {
      at = stat->find(' ', at);
      if (at == std::string::npos) return std::nullopt;
      ++at;
    }
    const char* first = stat->data() + at;
    const char* last = stat->data() + stat->size();
    std::uint64_t start = 0;
    auto [end, error] = std::from_chars(first, last, start);
    if (error != std::errc() || end == first || (end != last && *end != ' ')) return std::nullopt;
    return start;
  }

  bool executable(std::uint64_t* device, std::uint64_t* inode) const {
    struct stat info {};
    if (fstatat(fd_, "exe", &info, 0) != 0) return false;
    *device = info.st_dev;
    *inode = info.st_ino;
    return true;
  }

  bool runs(const AuditToken& token) const {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    return executable(&device, &inode) && device == token.exeDevice && inode == token.exeInode;
  }

  // The directory opened by pid names the token's process: the pid was not reused.
  bool isOf(const AuditToken& token) const { return valid() && startTime() == token.startTime; }

  std::optional<std::string> executablePath() const {
    char buffer[4096];
    ssize_t n = readlinkat(fd_, "exe", buffer, sizeof buffer - 1);
    if (n <= 0) return std::nullopt;
    return std::string(buffer, static_cast<std::size_t>(n));
  }

 private:
  struct Borrowed {};
  ProcDirectory(int directory, Borrowed) : fd_(directory) {}

  UniqueFd owned_;
  int fd_ = -1;
};

AuditToken tokenFrom(const ProcDirectory& process, pid_t pid, uid_t uid, gid_t gid) {
  if (!process.valid()) return AuditToken{};
  std::optional<std::uint64_t> start = process.startTime();
  AuditToken token;
  if (!start) return token;
  token.pid = pid;
  token.uid = uid;
  token.gid = gid;
  token.startTime = *start;
  if (!process.executable(&token.exeDevice, &token.exeInode)) return AuditToken{};
  return token;
}

// The held directory of the token's process when a connection has it pinned.
std::shared_ptr<const UniqueFd> pinnedDirectory(const AuditToken& token) {
  return PinnedProcesses::shared().directoryOf(token);
}

// The path of the program the process runs, when it is the token's.
std::optional<std::string> pathRun(const ProcDirectory& process, const AuditToken& token) {
  if (!process.runs(token)) return std::nullopt;
  std::optional<std::string> path = process.executablePath();
  // An exec between the two looks would name the new program.
  if (!path || !process.runs(token)) return std::nullopt;
  return path;
}

}  // namespace

std::optional<std::uint64_t> ProcessIdentity::startTime(pid_t pid) {
  ProcDirectory process(pid);
  return process.valid() ? process.startTime() : std::nullopt;
}

std::optional<std::string> ProcessIdentity::readProcessFile(pid_t pid, const char* name) {
  ProcDirectory process(pid);
  return process.valid() ? process.read(name) : std::nullopt;
}

AuditToken ProcessIdentity::ofProcess(pid_t pid, uid_t uid, gid_t gid) {
  return tokenFrom(ProcDirectory(pid), pid, uid, gid);
}

AuditToken ProcessIdentity::ofProcessDirectory(int directory, pid_t pid, uid_t uid, gid_t gid) {
  return tokenFrom(ProcDirectory::borrowing(directory), pid, uid, gid);
}

std::optional<std::uint64_t> ProcessIdentity::startTimeIn(int directory) {
  return ProcDirectory::borrowing(directory).startTime();
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
  if (auto pinned = pinnedDirectory(token))
    return ProcDirectory::borrowing(pinned->get()).runs(token);
  ProcDirectory process(token.pid);
  return process.isOf(token) && process.runs(token);
}

std::optional<std::string> ProcessIdentity::executablePath(const AuditToken& token) {
  if (token.isZero()) return std::nullopt;
  if (auto pinned = pinnedDirectory(token))
    return pathRun(ProcDirectory::borrowing(pinned->get()), token);
  ProcDirectory process(token.pid);
  if (!process.isOf(token)) return std::nullopt;
  return pathRun(process, token);
}

}  // namespace typhora
