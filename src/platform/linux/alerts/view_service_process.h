// A started view-service program, from its start until it is reaped.
//
// The child gets the endpoint as descriptor 3, a pipe as its standard input, and no other
// descriptor of the daemon beyond 0-2. What it is to read on standard input is written by lumo's
// I/O loop as the pipe takes it, so the caller never waits for the child. The child's end is
// watched through a pidfd on the same loop, which reaps it: no thread and no SIGCHLD handler.
// The loop keeps the object alive until then.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/fd/unique_fd.h"

namespace typhora {

class ViewServiceProcess : public std::enable_shared_from_this<ViewServiceProcess> {
 public:
  // Starts `program` with `arguments` (argv[1...]), `endpointFd` as its descriptor 3 and
  // `input` on its standard input; `onExit` (may be empty) runs once when it has been reaped.
  // False with `error` set when it could not be started; `onExit` is then not called.
  static bool launch(const std::string& program, const std::vector<std::string>& arguments,
                     int endpointFd, std::string input, std::function<void()> onExit,
                     std::string* error);

 private:
  ViewServiceProcess(pid_t pid, UniqueFd pidfd, UniqueFd input, std::string bytes,
                     std::function<void()> onExit);
  void watch();
  void onWritable();
  void onExit();
  void stopWriting();

  const pid_t pid_;
  std::mutex mutex_;  // the loop's handlers against watch()
  UniqueFd pidfd_;
  UniqueFd input_;
  std::string bytes_;
  std::size_t written_ = 0;
  std::function<void()> onExit_;
};

}  // namespace typhora
