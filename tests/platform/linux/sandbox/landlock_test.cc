// The Landlock policy of sandboxed applications: what it grants, and what the kernel then does
// with it in a forked child.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/linux/sandbox/landlock_abi.h"
#include "platform/linux/sandbox/landlock_enforcer.h"
#include "platform/linux/sandbox/landlock_policy.h"

namespace typhora {
namespace {

namespace fs = std::filesystem;

constexpr std::uint64_t kWrites =
    LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_REMOVE_FILE |
    LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
    LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO | LANDLOCK_ACCESS_FS_MAKE_BLOCK |
    LANDLOCK_ACCESS_FS_MAKE_SYM | LANDLOCK_ACCESS_FS_REFER | LANDLOCK_ACCESS_FS_TRUNCATE;

AppManifest sandboxed(std::vector<std::string> readOnlyPaths) {
  AppManifest manifest;
  manifest.identifier = "com.example.reader";
  manifest.sandboxed = true;
  manifest.readOnlyPaths = std::move(readOnlyPaths);
  return manifest;
}

TEST(LandlockPolicyTest, EachAbiHandlesEveryRightItKnows) {
  EXPECT_EQ(LandlockPolicy::fsRights(0), 0u);
  EXPECT_EQ(LandlockPolicy::fsRights(1), 0x1fffu);  // execute ... make symlink
  EXPECT_EQ(LandlockPolicy::fsRights(2), 0x3fffu);  // + refer
  EXPECT_EQ(LandlockPolicy::fsRights(3), 0x7fffu);  // + truncate
  EXPECT_EQ(LandlockPolicy::fsRights(4), 0x7fffu);
  EXPECT_EQ(LandlockPolicy::fsRights(5), 0xffffu);  // + device ioctls
  EXPECT_EQ(LandlockPolicy::fsRights(7), 0xffffu);
  EXPECT_EQ(LandlockPolicy::netRights(3), 0u);
  EXPECT_EQ(LandlockPolicy::netRights(4), 3u);  // TCP bind and connect
  EXPECT_EQ(LandlockPolicy::scopes(5), 0u);
  EXPECT_EQ(LandlockPolicy::scopes(6), 3u);  // abstract Unix sockets and signals
  // A newer kernel is handled at the newest level known, never at an unknown one.
  std::string error;
  auto policy = LandlockPolicy::forApplication(sandboxed({}), "/tmp/root", "/bin/true", 12, &error);
  ASSERT_TRUE(policy.has_value()) << error;
  EXPECT_EQ(policy->abi(), LandlockPolicy::kNewestKnownAbi);
  // A rule on a file keeps only the rights a file can carry; the kernel refuses the others.
  EXPECT_EQ(LandlockPolicy::forFile(LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR),
            LANDLOCK_ACCESS_FS_READ_FILE);
}

TEST(LandlockPolicyTest, OnlyTheManifestsPathsBeneathTheRootAndNoWrites) {
  std::string error;
  auto policy =
      LandlockPolicy::forApplication(sandboxed({"/var/mobile/Documents/", "relative/path"}),
                                     "/tmp/root", "/opt/app/reader", 7, &error);
  ASSERT_TRUE(policy.has_value()) << error;
  std::vector<std::string> rooted;
  for (const LandlockRule& rule : policy->rules()) {
    if (rule.beneathDeviceRoot) rooted.push_back(rule.path);
    EXPECT_NE(rule.path, "/tmp/root");
    EXPECT_EQ(rule.access & ~policy->handledFs(), 0u) << rule.path;
    // Nothing is written anywhere, but to the one device that keeps nothing.
    if (rule.path != "/dev/null") {
      EXPECT_EQ(rule.access & kWrites, 0u) << rule.path;
    }
    if (rule.path == "/opt/app/reader") {
      EXPECT_NE(rule.access & LANDLOCK_ACCESS_FS_EXECUTE, 0u);
    }
  }
  EXPECT_EQ(rooted, std::vector<std::string>{"/var/mobile/Documents/"});
  EXPECT_NE(policy->handledNet(), 0u);
  EXPECT_NE(policy->scoped(), 0u);
}

TEST(LandlockPolicyTest, ADeviceRootEveryProgramMayReadIsRefused) {
  std::string error;
  EXPECT_FALSE(
      LandlockPolicy::forApplication(sandboxed({}), "/usr/share/demo", "/bin/true", 7, &error));
  EXPECT_NE(error.find("/usr"), std::string::npos) << error;
  EXPECT_TRUE(
      LandlockPolicy::forApplication(sandboxed({}), "/usrlocal/root", "/bin/true", 7, &error));
  EXPECT_TRUE(LandlockPolicy::forApplication(sandboxed({}), "/", "/bin/true", 7, &error));
}

// The policy enforced for real in a child: each bit of its exit status is one expectation that
// failed.
TEST(LandlockEnforcerTest, TheKernelKeepsTheApplicationToItsPaths) {
  if (landlock::abiVersion() < 1) GTEST_SKIP() << "this kernel has no Landlock";
  char pattern[] = "/tmp/typhora-landlock-XXXXXX";
  ASSERT_NE(mkdtemp(pattern), nullptr);
  const fs::path dir = pattern;
  const fs::path root = dir / "root";
  fs::create_directories(root / "var/allowed");
  fs::create_directories(root / "var/denied");
  fs::create_directories(dir / "outside");
  std::ofstream(root / "var/allowed/a.otf") << "a";
  std::ofstream(root / "var/denied/b.otf") << "b";
  std::ofstream(dir / "outside/c.otf") << "c";
  // "/../outside" stays beneath the root (where it is not), never the directory beside it.
  std::string error;
  auto policy =
      LandlockPolicy::forApplication(sandboxed({"/var/allowed", "/../outside"}), root.string(),
                                     "/bin/true", landlock::abiVersion(), &error);
  ASSERT_TRUE(policy.has_value()) << error;

  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    std::string failure;
    if (!LandlockEnforcer::enforce(*policy, root.string(), &failure)) _exit(127);
    auto opens = [](const fs::path& path, int flags) {
      const int fd = open(path.c_str(), flags | O_CLOEXEC, 0600);
      if (fd >= 0) close(fd);
      return fd >= 0 ? 0 : errno;
    };
    int failed = 0;
    if (opens(root / "var/allowed/a.otf", O_RDONLY) != 0) failed |= 1;
    if (opens(root / "var/denied/b.otf", O_RDONLY) != EACCES) failed |= 2;
    if (opens(dir / "outside/c.otf", O_RDONLY) != EACCES) failed |= 4;
    if (opens(root / "var/allowed/a.otf", O_WRONLY) != EACCES) failed |= 8;
    if (opens(root / "var/allowed/new.otf", O_WRONLY | O_CREAT) != EACCES) failed |= 16;
    if (opens("/etc/passwd", O_RDONLY) != 0) failed |= 32;
    if (opens("/dev/null", O_WRONLY) != 0) failed |= 64;
    _exit(failed);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  fs::remove_all(dir);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
}  // namespace typhora
