#include "platform/linux/view_service_launch.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <thread>

#include "platform/json_codec.h"
#include "platform/linux/atomic_file.h"
#include "platform/linux/lumo_endpoint.h"
#include "platform/linux/unique_fd.h"
#include "platform/log.h"

extern char** environ;

namespace typhora {

namespace {

constexpr int kEndpointDescriptor = 3;

// posix_spawn's file actions, released however the spawn ends.
class SpawnActions {
 public:
  SpawnActions() { posix_spawn_file_actions_init(&actions_); }
  ~SpawnActions() { posix_spawn_file_actions_destroy(&actions_); }
  SpawnActions(const SpawnActions&) = delete;
  SpawnActions& operator=(const SpawnActions&) = delete;
  posix_spawn_file_actions_t* get() { return &actions_; }

 private:
  posix_spawn_file_actions_t actions_{};
};

}  // namespace

bool ViewServiceLaunch::start(const std::string& program, const std::vector<std::string>& arguments,
                              const std::shared_ptr<const IpcEndpoint>& endpoint,
                              const Value& userInfo) {
  const auto* lumo = dynamic_cast<const LumoEndpoint*>(endpoint.get());
  int input[2] = {-1, -1};
  if (lumo == nullptr || pipe2(input, O_CLOEXEC) != 0) {
    TYLog_Error(kTYLogTyphoraDaemon, "view service %@: no endpoint or pipe", program);
    return false;
  }
  UniqueFd reader(input[0]);
  UniqueFd writer(input[1]);
  SpawnActions actions;
  // dup2 clears close-on-exec on the copies; every other descriptor of the daemon has it set.
  posix_spawn_file_actions_adddup2(actions.get(), reader.get(), STDIN_FILENO);
  posix_spawn_file_actions_adddup2(actions.get(), lumo->fd(), kEndpointDescriptor);

  std::vector<std::string> words{program};
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv;
  for (std::string& word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  pid_t pid = -1;
  int error = posix_spawn(&pid, program.c_str(), actions.get(), nullptr, argv.data(), environ);
  if (error != 0) {
    TYLog_Error(kTYLogTyphoraDaemon, "view service %@: %s", program, std::strerror(error));
    return false;
  }
  reader.reset();
  std::string json = JsonCodec::encode(userInfo);
  std::thread([pid, writer = std::move(writer), json = std::move(json)]() mutable {
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(json.data());
    AtomicFile::writeAll(writer.get(), {bytes, json.size()});  // a program that doesn't read
    writer.reset();                                            // gets EPIPE, not a hang
    while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
    }
  }).detach();
  return true;
}

}  // namespace typhora
