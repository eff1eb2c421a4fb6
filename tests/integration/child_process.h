// A child process for integration tests: started with arguments, its stdout and stderr collected
// line by line on a reader thread, waited for or killed.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace typhora::testing {

class ChildProcess {
 public:
  // Starts `argv[0]` with `argv`, stdin from /dev/null. `env` entries ("K=V") are added.
  explicit ChildProcess(std::vector<std::string> argv, std::vector<std::string> env = {});
  ~ChildProcess();  // kills the process if it still runs
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  pid_t pid() const { return pid_; }
  // Waits for the exit and answers the exit status (128+signal when killed).
  int wait();
  // The same with a time limit: -1 when the process still runs after `timeout`.
  int waitFor(std::chrono::milliseconds timeout);
  // Waits until both output streams are closed, so output() is complete.
  void finishOutput();
  void kill(int signal);
  // Waits until an output line (stdout or stderr) contains `text`; false on timeout.
  bool waitForLine(const std::string& text, std::chrono::milliseconds timeout);
  // Lines containing `text` so far.
  std::size_t countLines(const std::string& text) const;
  std::string output() const;  // everything read so far, both streams interleaved by line
  std::string standardOutput() const;

 private:
  void readLoop(int fd, bool isStdout);

  pid_t pid_ = -1;
  int status_ = -1;
  bool waited_ = false;
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> lines_;
  std::string stdout_;
  std::thread stdoutReader_;
  std::thread stderrReader_;
};

// Runs a command to its end and answers exit status and output.
struct CommandResult {
  int status = -1;
  std::string out;  // stdout
  std::string all;  // stdout and stderr
};
CommandResult runCommand(std::vector<std::string> argv, std::chrono::milliseconds timeout);

}  // namespace typhora::testing
