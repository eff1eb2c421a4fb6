#include "platform/linux/alerts/view_service_process.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/epoll.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <thread>

#include "platform/linux/lumo/transport/lumo_event_loop.h"
#include "platform/log/log.h"

extern char** environ;

namespace typhora {
namespace {

// Descriptors the child's dup2 calls start from sit above the ones they go to, so that no dup2
// is a no-op that would leave close-on-exec set.
constexpr int kFirstSpareFd = 10;

// A write that turns a closed pipe into EPIPE without raising SIGPIPE in the process.
ssize_t writeWithoutSigpipe(int fd, const char* data, std::size_t size) {
  sigset_t pipeSignal;
  sigset_t previous;
  sigemptyset(&pipeSignal);
  sigaddset(&pipeSignal, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipeSignal, &previous);
  const ssize_t n = ::write(fd, data, size);
  const int saved = errno;
  if (n < 0 && saved == EPIPE) {
    const timespec none{};
    sigtimedwait(&pipeSignal, nullptr, &none);  // takes the SIGPIPE this thread just got
  }
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  errno = saved;
  return n;
}

// posix_spawn with the child's descriptors 0 and 3 set and every other one from 4 up closed,
// and the signals the daemon ignores back to their defaults. Answers 0 or an errno value.
int spawn(const std::string& program, const std::vector<std::string>& arguments, int stdinFd,
          int endpointFd, pid_t* pid) {
  std::vector<std::string> strings{program};
  strings.insert(strings.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv;
  for (std::string& s : strings) argv.push_back(s.data());
  argv.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attributes;
  posix_spawn_file_actions_init(&actions);
  posix_spawnattr_init(&attributes);
  posix_spawn_file_actions_adddup2(&actions, stdinFd, 0);
  posix_spawn_file_actions_adddup2(&actions, endpointFd, 3);
  posix_spawn_file_actions_addclosefrom_np(&actions, 4);
  sigset_t signals;
  sigemptyset(&signals);
  posix_spawnattr_setsigmask(&attributes, &signals);
  sigaddset(&signals, SIGPIPE);
  sigaddset(&signals, SIGCHLD);
  posix_spawnattr_setsigdefault(&attributes, &signals);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  const int result = posix_spawn(pid, program.c_str(), &actions, &attributes, argv.data(), environ);
  posix_spawnattr_destroy(&attributes);
  posix_spawn_file_actions_destroy(&actions);
  return result;
}

bool failed(std::string* error, const std::string& what, int code) {
  *error = what + ": " + std::strerror(code);
  return false;
}

}  // namespace

bool ViewServiceProcess::launch(const std::string& program,
                                const std::vector<std::string>& arguments, int endpointFd,
                                std::string input, std::function<void()> onExit,
                                std::string* error) {
  UniqueFd endpoint(fcntl(endpointFd, F_DUPFD_CLOEXEC, kFirstSpareFd));
  if (!endpoint.valid()) return failed(error, "the endpoint's descriptor", errno);
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return failed(error, "pipe2", errno);
  UniqueFd pipeRead(fds[0]);
  UniqueFd pipeWrite(fds[1]);
  UniqueFd childInput(fcntl(pipeRead.get(), F_DUPFD_CLOEXEC, kFirstSpareFd));
  if (!childInput.valid()) return failed(error, "fcntl", errno);
  pipeRead.reset();

  pid_t pid = -1;
  if (int code = spawn(program, arguments, childInput.get(), endpoint.get(), &pid); code != 0) {
    return failed(error, program, code);
  }
  childInput.reset();
  fcntl(pipeWrite.get(), F_SETFL, fcntl(pipeWrite.get(), F_GETFL) | O_NONBLOCK);
  // Through syscall(): this C library's pidfd header declares its functions without C linkage.
  UniqueFd pidfd(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
  if (!pidfd.valid()) {
    // Kernels before 5.3 have no pidfd: one waiting thread for this child, then.
    std::thread([pid, onExit = std::exchange(onExit, {})] {
      waitpid(pid, nullptr, 0);
      if (onExit) onExit();
    }).detach();
  }
  auto process = std::shared_ptr<ViewServiceProcess>(new ViewServiceProcess(
      pid, std::move(pidfd), std::move(pipeWrite), std::move(input), std::move(onExit)));
  process->watch();
  return true;
}

ViewServiceProcess::ViewServiceProcess(pid_t pid, UniqueFd pidfd, UniqueFd input, std::string bytes,
                                       std::function<void()> onExit)
    : pid_(pid),
      pidfd_(std::move(pidfd)),
      input_(std::move(input)),
      bytes_(std::move(bytes)),
      onExit_(std::move(onExit)) {}

void ViewServiceProcess::watch() {
  std::lock_guard lock(mutex_);
  auto self = shared_from_this();
  if (bytes_.empty()) {
    input_.reset();
  } else {
    LumoEventLoop::shared().add(input_.get(), EPOLLOUT,
                                [self](std::uint32_t) { self->onWritable(); });
  }
  if (pidfd_.valid()) {
    LumoEventLoop::shared().add(pidfd_.get(), EPOLLIN, [self](std::uint32_t) { self->onExit(); });
  }
}

void ViewServiceProcess::onWritable() {
  std::lock_guard lock(mutex_);
  if (!input_.valid()) return;
  while (written_ < bytes_.size()) {
    const ssize_t n =
        writeWithoutSigpipe(input_.get(), bytes_.data() + written_, bytes_.size() - written_);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && errno == EAGAIN) return;
    if (n < 0) break;  // the child closed its input; what it did not read is dropped
    written_ += static_cast<std::size_t>(n);
  }
  stopWriting();
}

void ViewServiceProcess::onExit() {
  siginfo_t info{};
  const int result = waitid(P_PIDFD, static_cast<id_t>(pidfd_.get()), &info, WEXITED | WNOHANG);
  if (result != 0 && errno == EINTR) return;
  if (result == 0 && info.si_pid == 0) return;  // not ended yet
  if (result == 0 && (info.si_code != CLD_EXITED || info.si_status != 0)) {
    TYLog_Error(kTYLogTyphoraDaemon, "view service %d ended with status %d", pid_, info.si_status);
  }
  std::function<void()> onExit;
  {
    std::lock_guard lock(mutex_);
    stopWriting();
    LumoEventLoop::shared().remove(pidfd_.get());
    pidfd_.reset();
    onExit = std::exchange(onExit_, {});
  }
  if (onExit) onExit();
}

void ViewServiceProcess::stopWriting() {
  if (!input_.valid()) return;
  LumoEventLoop::shared().remove(input_.get());
  input_.reset();
  std::string().swap(bytes_);
}

}  // namespace typhora
