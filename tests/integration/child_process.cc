#include "integration/child_process.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

namespace typhora::testing {
namespace {

int decodeStatus(int raw) {
  if (WIFEXITED(raw)) return WEXITSTATUS(raw);
  if (WIFSIGNALED(raw)) return 128 + WTERMSIG(raw);
  return -1;
}

}  // namespace

ChildProcess::ChildProcess(std::vector<std::string> argv, std::vector<std::string> env) {
  int out[2];
  int err[2];
  if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) std::abort();
  std::vector<char*> args;
  for (auto& a : argv) args.push_back(a.data());
  args.push_back(nullptr);
  pid_ = fork();
  if (pid_ == 0) {
    int devnull = open("/dev/null", O_RDONLY);
    dup2(devnull, 0);
    dup2(out[1], 1);
    dup2(err[1], 2);
    for (auto& e : env) putenv(e.data());
    execv(args[0], args.data());
    _exit(127);
  }
  close(out[1]);
  close(err[1]);
  stdoutReader_ = std::thread([this, fd = out[0]] { readLoop(fd, true); });
  stderrReader_ = std::thread([this, fd = err[0]] { readLoop(fd, false); });
}

ChildProcess::~ChildProcess() {
  if (!waited_) {
    kill(SIGKILL);
    wait();
  }
  finishOutput();
}

void ChildProcess::finishOutput() {
  if (stdoutReader_.joinable()) stdoutReader_.join();
  if (stderrReader_.joinable()) stderrReader_.join();
}

void ChildProcess::readLoop(int fd, bool isStdout) {
  std::string pending;
  char buffer[4096];
  for (;;) {
    ssize_t n = read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    std::lock_guard lock(mutex_);
    if (isStdout) stdout_.append(buffer, static_cast<std::size_t>(n));
    pending.append(buffer, static_cast<std::size_t>(n));
    for (std::size_t nl; (nl = pending.find('\n')) != std::string::npos;) {
      lines_.push_back(pending.substr(0, nl));
      pending.erase(0, nl + 1);
    }
    changed_.notify_all();
  }
  std::lock_guard lock(mutex_);
  if (!pending.empty()) lines_.push_back(pending);
  changed_.notify_all();
  close(fd);
}

int ChildProcess::wait() {
  if (!waited_) {
    int raw = 0;
    while (waitpid(pid_, &raw, 0) < 0 && errno == EINTR) {
    }
    status_ = decodeStatus(raw);
    waited_ = true;
  }
  return status_;
}

int ChildProcess::waitFor(std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!waited_) {
    int raw = 0;
    pid_t done = waitpid(pid_, &raw, WNOHANG);
    if (done == pid_) {
      status_ = decodeStatus(raw);
      waited_ = true;
    } else if (std::chrono::steady_clock::now() >= deadline) {
      return -1;
    } else {
      usleep(2000);
    }
  }
  return status_;
}

void ChildProcess::kill(int signal) {
  if (!waited_) ::kill(pid_, signal);
}

bool ChildProcess::waitForLine(const std::string& text, std::chrono::milliseconds timeout) {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] {
    for (const auto& line : lines_) {
      if (line.find(text) != std::string::npos) return true;
    }
    return false;
  });
}

std::size_t ChildProcess::countLines(const std::string& text) const {
  std::lock_guard lock(mutex_);
  std::size_t n = 0;
  for (const auto& line : lines_) n += line.find(text) != std::string::npos ? 1 : 0;
  return n;
}

std::string ChildProcess::output() const {
  std::lock_guard lock(mutex_);
  std::string all;
  for (const auto& line : lines_) all += line + "\n";
  return all;
}

std::string ChildProcess::standardOutput() const {
  std::lock_guard lock(mutex_);
  return stdout_;
}

CommandResult runCommand(std::vector<std::string> argv, std::chrono::milliseconds timeout) {
  ChildProcess child(std::move(argv));
  CommandResult result;
  result.status = child.waitFor(timeout);
  if (result.status < 0) {
    child.kill(SIGKILL);
    child.wait();
  }
  child.finishOutput();
  result.out = child.standardOutput();
  result.all = child.output();
  return result;
}

}  // namespace typhora::testing
