#include "child_launcher.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace typhora::ctl {

namespace {

constexpr int kHandedOverFd = 3;

}  // namespace

pid_t ChildLauncher::start(const std::string& program, const std::vector<std::string>& arguments,
                           int fd, std::string* error) {
  std::vector<std::string> strings{program};
  strings.insert(strings.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv;
  for (std::string& s : strings) argv.push_back(s.data());
  argv.push_back(nullptr);
  // Moved above 3 first, so that the dup2 below always clears close-on-exec.
  const int spare = fcntl(fd, F_DUPFD_CLOEXEC, 10);
  if (spare < 0) {
    *error = std::string("fcntl: ") + std::strerror(errno);
    return -1;
  }
  const pid_t pid = fork();
  if (pid == 0) {
    // Only async-signal-safe calls between fork and exec.
    if (dup2(spare, kHandedOverFd) < 0) _exit(127);
    execv(program.c_str(), argv.data());
    _exit(127);
  }
  const int saved = errno;
  close(spare);
  if (pid < 0) *error = std::string("fork: ") + std::strerror(saved);
  return pid;
}

int ChildLauncher::wait(pid_t pid) {
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace typhora::ctl
