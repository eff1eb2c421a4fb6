// The daemon's event socket with real typhoractl peers: posting, watching, activities, and who
// may connect at all.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class EventSocketTest : public DaemonTestBase {
 protected:
  void SetUp() override {
    DaemonTestBase::SetUp();
    fs::create_directories(root_ / "etc/typhora");
    std::ofstream(root_ / "etc/typhora/typhorad.launch.plist")
        << R"({"LaunchEvents": {"systemNotification": ["com.example.ping"],
                 "distributedNotification": ["com.zorvane.Apploom.applicationUnregistered"]},
               "Activities": {"com.zorvane.typhorad.check-asset-update": {"Interval": 86400}}})";
  }
  // The event socket opens once the daemon has started up.
  void waitForEventSocket() {
    for (int i = 0; i < 1000 && !fs::exists(runtime_ / kEventSocket); ++i)
      std::this_thread::sleep_for(5ms);
    ASSERT_TRUE(fs::exists(runtime_ / kEventSocket)) << daemon_->output();
  }
  void startDaemonAndEvents() {
    startDaemon();
    waitForEventSocket();
  }

  static constexpr const char* kEventSocket = "com.zorvane.typhorad.events";
};

TEST_F(EventSocketTest, WatchersSeeEveryPostedNotification) {
  startDaemonAndEvents();
  ChildProcess watcher({kCtl, "--runtime-dir", runtime_, "event", "watch", "--count", "2"});
  ASSERT_TRUE(watcher.waitForLine("watching", 30s)) << watcher.output();

  auto system = ctl({"event", "post", "--system", "com.example.ping"});
  ASSERT_EQ(system.status, 0) << system.all;
  auto distributed = ctl({"event", "post", "--distributed", "com.example.removed",
                          R"({"bundleIDs": ["com.example.app"]})"});
  ASSERT_EQ(distributed.status, 0) << distributed.all;

  ASSERT_EQ(watcher.waitFor(10s), 0) << watcher.output();
  watcher.finishOutput();
  EXPECT_EQ(watcher.standardOutput(),
            "{\"kind\":\"system\",\"name\":\"com.example.ping\"}\n"
            "{\"kind\":\"distributed\",\"name\":\"com.example.removed\","
            "\"userInfo\":{\"bundleIDs\":[\"com.example.app\"]}}\n");
}

TEST_F(EventSocketTest, BadRequestsGetClearAnswers) {
  startDaemonAndEvents();
  auto notJson = ctl({"event", "post", "--distributed", "com.example.x", "[1, 2]"});
  EXPECT_EQ(notJson.status, 2);
  EXPECT_THAT(notJson.all, HasSubstr("must be a JSON object"));

  auto unknown = ctl({"activity", "run", "com.example.nothing"});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_THAT(unknown.all, HasSubstr("no activity com.example.nothing is registered"));

  // The daemon still serves its clients.
  EXPECT_EQ(ctl({"updating-user-fonts"}).status, 0);
}

TEST_F(EventSocketTest, OnlyRootAndTheDaemonsUserMayConnect) {
  if (getuid() != 0) GTEST_SKIP() << "needs root to run a peer as another user";
  startDaemonAndEvents();
  const fs::path socket = runtime_ / kEventSocket;
  struct stat info {};
  ASSERT_EQ(stat(socket.c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0600u);

  // Even with the file opened up, the kernel's word on the peer keeps others out.
  chmod(dir_.c_str(), 0755);
  chmod(socket.c_str(), 0666);
  auto other = runCommand({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                           kCtl, "--runtime-dir", runtime_, "event", "post", "--system", "x"},
                          20s);
  EXPECT_NE(other.status, 0) << other.all;
  ASSERT_TRUE(daemon_->waitForLine("event socket: refused", 30s)) << daemon_->output();
  EXPECT_EQ(ctl({"event", "post", "--system", "x"}).status, 0);
}

TEST_F(EventSocketTest, TheCatalogActivityDownloadsAndTheAssetServiceAnnouncesIt) {
  std::ofstream(dir_ / "catalog.json") << R"([{"type": "FontAccess",
      "_CompatibilityVersion": "1", "FontAccess": {"com.example.app": ["1.0"]}}])";
  std::ofstream(root_ / "etc/typhora/asset-sources.plist")
      << R"({"com.zorvane.Cargell.ScrivaneAssets": ")" << (dir_ / "catalog.json").string()
      << R"("})";
  startDaemonAndEvents();
  ChildProcess watcher({kCtl, "--runtime-dir", runtime_, "event", "watch", "--count", "1"});
  ASSERT_TRUE(watcher.waitForLine("watching", 30s)) << watcher.output();

  auto run = ctl({"activity", "run", "com.zorvane.typhorad.check-asset-update"});
  ASSERT_EQ(run.status, 0) << run.all << daemon_->output();
  ASSERT_TRUE(daemon_->waitForLine("asset catalog updated. (0)", 10s)) << daemon_->output();
  ASSERT_EQ(watcher.waitFor(10s), 0) << watcher.output();
  watcher.finishOutput();
  EXPECT_THAT(watcher.output(),
              HasSubstr("com.zorvane.Cargell.ScrivaneAssets.cg.cached-metadata-updated"));
  EXPECT_TRUE(
      fs::exists(root_ / "var/typhora/assets/com.zorvane.Cargell.ScrivaneAssets/catalog.plist"));
}

TEST_F(EventSocketTest, ARemovedApplicationTakesItsFontsWithIt) {
  const fs::path font = root_ / "var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf";
  fs::create_directories(font.parent_path());
  std::ofstream(font) << "font";
  startDaemonAndEvents();
  auto posted =
      ctl({"event", "post", "--distributed", "com.zorvane.Apploom.applicationUnregistered",
           R"({"bundleIDs": ["com.example.shop"]})"});
  ASSERT_EQ(posted.status, 0) << posted.all;
  ASSERT_TRUE(daemon_->waitForLine("synchroning FontProviders", 30s)) << daemon_->output();
  EXPECT_FALSE(fs::exists(font.parent_path()));
  auto info =
      ctl({"plist", "show", (root_ / "var/mobile/Library/UserFonts/UserFonts.plist").string()});
  EXPECT_THAT(info.out, Not(HasSubstr("com.example.shop")));
}

TEST_F(EventSocketTest, AnEventStartsTheDaemonThroughSocketActivation) {
  const std::string activate = "/usr/bin/systemd-socket-activate";
  if (!fs::exists(activate)) GTEST_SKIP() << "systemd-socket-activate is not installed";
  std::vector<std::string> argv = {activate,
                                   "-l",
                                   (runtime_ / kService).string(),
                                   "-l",
                                   (runtime_ / kEventSocket).string(),
                                   std::string("--fdname=") + kService + ":" + kEventSocket};
  auto args = daemonArgs();
  argv.insert(argv.end(), args.begin(), args.end());
  daemon_ = std::make_unique<ChildProcess>(argv);
  waitForEventSocket();

  // The post starts the daemon, which answers it on the inherited socket.
  auto posted = ctl({"event", "post", "--system", "com.example.ping"});
  ASSERT_EQ(posted.status, 0) << posted.all << daemon_->output();
  EXPECT_TRUE(daemon_->waitForLine("notification posted: com.example.ping", 30s))
      << daemon_->output();
  EXPECT_EQ(ctl({"updating-user-fonts"}).status, 0) << daemon_->output();
}

}  // namespace
}  // namespace typhora::testing
