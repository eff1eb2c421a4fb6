// Identity queries about peers held pinned, which go through the pinned /proc directory instead
// of opening /proc/<pid> afresh: they must still catch an exec and an exit, and never answer for
// a token the pin does not match. Real processes on a socket pair.
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string>

#include <gtest/gtest.h>

#include "platform/fd/unique_fd.h"
#include "platform/linux/identity/pinned_processes.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/linux/identity/process_pin.h"

namespace typhora {
namespace {

std::filesystem::path exeOf(pid_t pid) {
  std::error_code ec;
  return std::filesystem::read_symlink("/proc/" + std::to_string(pid) + "/exe", ec);
}

bool waitForExe(pid_t pid, const std::filesystem::path& program) {
  for (int i = 0; i < 5000; ++i) {
    if (exeOf(pid) == program) return true;
    usleep(1000);
  }
  return false;
}

// A shell connected to a listening socket of this process (SO_PEERCRED names the connecting
// process; a socket pair would name its creator) that execs `sleep` once it reads a line.
class ShellPeer {
 public:
  ShellPeer() {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    // An abstract name, unique per peer: nothing on disk to clean up.
    const std::string name = "typhora-pin-test-" + std::to_string(getpid()) + "-" +
                             std::to_string(reinterpret_cast<std::uintptr_t>(this));
    std::copy(name.begin(), name.end(), address.sun_path + 1);
    const socklen_t length = offsetof(sockaddr_un, sun_path) + 1 + name.size();
    UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (bind(listener.get(), reinterpret_cast<sockaddr*>(&address), length) != 0 ||
        listen(listener.get(), 1) != 0)
      return;
    pid_ = fork();
    if (pid_ == 0) {
      int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
      if (connect(fd, reinterpret_cast<sockaddr*>(&address), length) != 0) _exit(126);
      dup2(fd, 0);
      execl("/bin/sh", "sh", "-c", "read line; exec sleep 60", static_cast<char*>(nullptr));
      _exit(127);
    }
    socket_ = accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC);
  }
  ~ShellPeer() {
    stop();
    if (socket_ >= 0) close(socket_);
  }
  void execSleep() const { (void)!write(socket_, "\n", 1); }
  void stop() {
    if (pid_ <= 0) return;
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
  pid_t pid() const { return pid_; }
  int socket() const { return socket_; }

 private:
  pid_t pid_ = -1;
  int socket_ = -1;
};

TEST(PinnedProcessesTest, APinnedPeerIsCheckedThroughItsDirectoryAndLosesItsIdentityOnExecAndExit) {
  const std::filesystem::path shell = std::filesystem::canonical("/bin/sh");
  const std::filesystem::path sleep = std::filesystem::canonical("/bin/sleep");
  ShellPeer peer;
  ASSERT_TRUE(waitForExe(peer.pid(), shell));

  ProcessPin pin = ProcessPin::ofSocketPeer(peer.socket());
  ASSERT_TRUE(pin.pinned());
  const AuditToken token = pin.token();
  ASSERT_NE(PinnedProcesses::shared().directoryOf(token), nullptr);
  EXPECT_TRUE(ProcessIdentity::isValid(token));
  EXPECT_EQ(ProcessIdentity::executablePath(token), shell.string());

  // A token that differs from the pinned one in any part is not answered by the pin.
  AuditToken otherStart = token;
  ++otherStart.startTime;
  AuditToken otherProgram = token;
  ++otherProgram.exeInode;
  for (const AuditToken& other : {otherStart, otherProgram}) {
    EXPECT_EQ(PinnedProcesses::shared().directoryOf(other), nullptr);
    EXPECT_FALSE(ProcessIdentity::isValid(other));
    EXPECT_FALSE(ProcessIdentity::executablePath(other));
  }

  peer.execSleep();
  ASSERT_TRUE(waitForExe(peer.pid(), sleep));
  EXPECT_EQ(pin.state(), ProcessPin::State::Changed);
  EXPECT_FALSE(ProcessIdentity::isValid(token));
  EXPECT_FALSE(ProcessIdentity::executablePath(token));
  // The new program's identity, taken afresh, is valid: the pin only answers for its own.
  EXPECT_TRUE(ProcessIdentity::isValid(ProcessIdentity::ofProcess(peer.pid(), getuid(), getgid())));

  peer.stop();
  EXPECT_EQ(pin.state(), ProcessPin::State::Gone);
  EXPECT_FALSE(ProcessIdentity::isValid(token));

  pin = ProcessPin();
  EXPECT_EQ(PinnedProcesses::shared().directoryOf(token), nullptr);
}

TEST(PinnedProcessesTest, ReleasedPinsLeaveNoEntriesBehind) {
  const std::size_t before = PinnedProcesses::shared().sizeForTesting();
  for (int round = 0; round < 200; ++round) {
    ShellPeer peer;
    ASSERT_TRUE(waitForExe(peer.pid(), std::filesystem::canonical("/bin/sh")));
    ProcessPin pin = ProcessPin::ofSocketPeer(peer.socket());
    ASSERT_TRUE(pin.pinned());
  }
  // Entries of released pins are swept as new ones come: never more than a sweep's worth.
  EXPECT_LE(PinnedProcesses::shared().sizeForTesting(), before + 64);
}

}  // namespace
}  // namespace typhora
