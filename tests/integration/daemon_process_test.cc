// The real typhorad in a temporary device root, called by real typhoractl processes.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using ::testing::HasSubstr;

using DaemonProcessTest = DaemonTestBase;

TEST_F(DaemonProcessTest, ClientsAreAnsweredAndEachLeavesOneHandlerBehind) {
  startDaemon();
  auto result = ctl({"updating-user-fonts"});
  ASSERT_EQ(result.status, 0) << result.all << daemon_->output();
  EXPECT_EQ(result.out, "{}\n");

  ASSERT_TRUE(daemon_->waitForLine("TyphoraHandler deallocated.", 30s)) << daemon_->output();
  std::this_thread::sleep_for(200ms);
  EXPECT_EQ(daemon_->countLines("TyphoraHandler deallocated."), 1u) << daemon_->output();

  // Several clients at once are all answered, and each goes away once.
  std::vector<std::thread> clients;
  std::atomic<int> answered{0};
  for (int i = 0; i < 8; ++i) {
    clients.emplace_back([&] { answered += ctl({"call", "updatingUserFonts:"}).status == 0; });
  }
  for (auto& t : clients) t.join();
  EXPECT_EQ(answered.load(), 8);
  for (int i = 0; i < 500 && daemon_->countLines("TyphoraHandler deallocated.") < 9; ++i) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(daemon_->countLines("TyphoraHandler deallocated."), 9u);
}

TEST_F(DaemonProcessTest, RefusedOperationsLeaveTheDaemonServing) {
  startDaemon();
  // Not an operation of the service at all: refused by the IPC layer before any handler runs.
  auto unknown = ctl({"call", "--unchecked", "eraseAllFonts:"});
  EXPECT_NE(unknown.status, 0) << unknown.all;
  EXPECT_TRUE(daemon_->waitForLine("lumo error:", 30s)) << daemon_->output();

  // A wrong argument type is refused the same way.
  auto wrongType = ctl({"call", "--unchecked", "scheduleFontFilesDeletion:", "42"});
  EXPECT_TRUE(daemon_->waitForLine("scheduleFontFilesDeletion:", 30s)) << daemon_->output();
  (void)wrongType;

  // A request of the wrong shape from a program nobody signed: answered with nothing.
  auto request = ctl({"call", "requestFonts:reply:", "[\"Serif\"]"});
  EXPECT_EQ(request.out, "[{}]\n") << request.all;

  auto ok = ctl({"updating-user-fonts"});
  EXPECT_EQ(ok.status, 0) << ok.all << daemon_->output();
}

TEST_F(DaemonProcessTest, ScheduledFontFilesAreDeletedWhenDue) {
  const fs::path font = root_ / "var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf";
  fs::create_directories(font.parent_path());
  std::ofstream(font) << "font";
  fs::create_directories(root_ / "var/mobile/Library/Preferences");
  std::ofstream(root_ / "var/mobile/Library/Preferences/com.zorvane.typhorad.plist")
      << R"({"version": 1, "deleteDelay": 0.5})";  // under a second: due at once
  startDaemon();
  auto scheduled = ctl({"call", "scheduleFontFilesDeletion:",
                        R"(["/var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf"])"});
  ASSERT_EQ(scheduled.status, 0) << scheduled.all;
  EXPECT_EQ(scheduled.out, "[]\n");
  ASSERT_TRUE(daemon_->waitForLine("all files deleted.", 30s)) << daemon_->output();
  EXPECT_FALSE(fs::exists(font.parent_path()));
}

TEST_F(DaemonProcessTest, StartsThroughSocketActivation) {
  const std::string socket = (runtime_ / kService).string();
  std::vector<std::string> argv = {"/usr/bin/systemd-socket-activate", "-l", socket,
                                   std::string("--fdname=") + kService};
  auto args = daemonArgs();
  argv.insert(argv.end(), args.begin(), args.end());
  if (!fs::exists(argv[0])) GTEST_SKIP() << "systemd-socket-activate is not installed";
  daemon_ = std::make_unique<ChildProcess>(argv);
  waitForSocket();

  // The daemon starts on the first connection and answers it on the inherited socket.
  auto result = ctl({"updating-user-fonts"});
  ASSERT_EQ(result.status, 0) << result.all << daemon_->output();
  EXPECT_EQ(result.out, "{}\n");
  EXPECT_TRUE(daemon_->waitForLine("TyphoraHandler deallocated.", 30s)) << daemon_->output();
}

TEST_F(DaemonProcessTest, ToolsExplainThemselves) {
  auto daemonHelp = runCommand({kDaemon, "--help"}, 10s);
  EXPECT_EQ(daemonHelp.status, 0);
  EXPECT_THAT(daemonHelp.out, HasSubstr("--root"));
  auto ctlHelp = ctl({"--help"});
  EXPECT_EQ(ctlHelp.status, 0);
  EXPECT_THAT(ctlHelp.out, HasSubstr("plist"));
  auto bad = runCommand({kDaemon, "--no-such-option"}, 10s);
  EXPECT_EQ(bad.status, 2);
  EXPECT_THAT(bad.all, HasSubstr("unknown option"));
}

TEST_F(DaemonProcessTest, PlistFilesConvertBothWays) {
  const std::string json = (root_ / "var/mobile/Library/UserFonts/UserFonts.plist").string();
  const std::string cbor = (dir_ / "fonts.cbor").string();
  const std::string back = (dir_ / "fonts.json").string();
  ASSERT_EQ(ctl({"plist", "convert", "--to", "cbor", json, cbor}).status, 0);
  ASSERT_EQ(ctl({"plist", "convert", "--to", "json", cbor, back}).status, 0);
  auto fromJson = ctl({"plist", "show", json});
  auto fromCbor = ctl({"plist", "show", cbor});
  EXPECT_EQ(fromJson.status, 0);
  EXPECT_EQ(fromJson.out, fromCbor.out);
  EXPECT_THAT(fromCbor.out, HasSubstr("\"A-Regular\": \"A\""));

  std::ofstream(dir_ / "broken.json") << "{\"unterminated\": ";
  auto broken = ctl({"plist", "show", (dir_ / "broken.json").string()});
  EXPECT_EQ(broken.status, 1);
  EXPECT_THAT(broken.all, HasSubstr("broken.json"));
}

}  // namespace
}  // namespace typhora::testing
