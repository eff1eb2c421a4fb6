// The daemon under the restrictions of its installed unit, as far as a test can apply them
// without a systemd manager (systemd-run needs a user session, which containers and CI lack):
//   User=                  an unprivileged user (nobody) owning the device root and runtime dir
//   NoNewPrivileges=       setpriv --no-new-privs
//   CapabilityBoundingSet=CAP_SYS_PTRACE, AmbientCapabilities=CAP_SYS_PTRACE
//                          setpriv --inh-caps, --ambient-caps, --bounding-set: only the one
//                          capability that lets it pin peers of other users (reading their
//                          /proc entries)
//   ProtectSystem=strict   a private mount namespace with / remounted read-only, the test's
//                          directory bound writable in its place
//   ProtectHome=, PrivateTmp=   empty tmpfs over /home, /root and /var/tmp (the test directory
//                          lives in /tmp, which stays)
//   LimitNOFILE=           prlimit (up to this machine's hard limit)
// RestrictAddressFamilies= and SystemCallFilter= need a seccomp filter and are not applied here;
// the daemon's sockets are all AF_UNIX and the units pass systemd-analyze verify.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

constexpr const char* kNobody = "65534";
constexpr const char* kConfine =
    "mount --bind \"$DIR\" \"$DIR\" && mount -o remount,bind,ro / && "
    "for d in /home /root /var/tmp; do [ ! -d $d ] || mount -t tmpfs -o mode=0755 tmpfs $d; done "
    "&& "
    "exec setpriv --reuid=65534 --regid=65534 --clear-groups --no-new-privs "
    "--inh-caps=-all,+sys_ptrace --ambient-caps=-all,+sys_ptrace --bounding-set=-all,+sys_ptrace "
    "\"$@\"";

std::string procStatusField(pid_t pid, const std::string& field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);)
    if (line.starts_with(field + ":")) return line.substr(field.size() + 1);
  return {};
}

class HardenedDaemonTest : public DaemonTestBase {
 protected:
  void startConfinedDaemon() {
    for (const auto& entry : fs::recursive_directory_iterator(dir_))
      ASSERT_EQ(lchown(entry.path().c_str(), 65534, 65534), 0) << entry.path();
    ASSERT_EQ(chown(dir_.c_str(), 65534, 65534), 0);
    // The unit's 65536, or as many as this machine lets a process have.
    rlimit limit{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
    const rlim_t files = std::min<rlim_t>(65536, limit.rlim_max);
    std::vector<std::string> argv = {"/usr/bin/prlimit", "--nofile=" + std::to_string(files),
                                     "/usr/bin/unshare", "--mount",
                                     "--propagation",    "private",
                                     "/bin/sh",          "-c",
                                     kConfine,           "sh"};
    for (const std::string& arg : daemonArgs()) argv.push_back(arg);
    daemon_ =
        std::make_unique<ChildProcess>(argv, std::vector<std::string>{"DIR=" + dir_.string()});
    waitForSocket();
  }
};

TEST_F(HardenedDaemonTest, ServesInstallsStatusAndGrantsUnderTheUnitsRestrictions) {
  const std::string browser =
      installApp("browser", "com.example.browser",
                 R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})");
  startConfinedDaemon();
  const pid_t pid = daemon_->pid();
  EXPECT_THAT(procStatusField(pid, "Uid"), HasSubstr(kNobody)) << daemon_->output();
  EXPECT_THAT(procStatusField(pid, "NoNewPrivs"), HasSubstr("1"));
  EXPECT_THAT(procStatusField(pid, "CapBnd"), HasSubstr("0000000000080000"));  // CAP_SYS_PTRACE

  ChildProcess client({browser, "--runtime-dir", runtime_, "client", "--watch", "--count", "1"});
  ASSERT_TRUE(client.waitForLine(R"("event":"checkin")", 20s))
      << client.output() << daemon_->output();
  auto installed = ctl({"--root", root_.string(), "font", "install", "--provider",
                        "com.example.fonts", "/usr/share/fonts/truetype/dejavu/DejaVuSans.ttf"});
  ASSERT_EQ(installed.status, 0) << installed.all;
  EXPECT_THAT(installed.out, HasSubstr(R"("notified":true)"));
  EXPECT_EQ(client.waitFor(20s), 0) << client.output() << daemon_->output();
  EXPECT_THAT(client.output(), HasSubstr("com.example.fonts/DejaVuSans.ttf"));

  auto status = ctl({"status"});
  ASSERT_EQ(status.status, 0) << status.all << daemon_->output();
  EXPECT_THAT(status.out, HasSubstr(R"("generation":1)"));
  // The daemon wrote its own state beneath the root, as the user it runs as.
  EXPECT_TRUE(fs::exists(root_ / "var/mobile/Library/UserFonts/FontFiles"));
  EXPECT_THAT(daemon_->output(), Not(HasSubstr("Read-only file system")));
}

}  // namespace
}  // namespace typhora::testing
