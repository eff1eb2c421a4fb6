// A hostile local user against the real typhorad: client-named paths that try to leave the font
// directories, links planted where the daemon removes files, FIFOs where it reads files, bad
// start-up options and forged log lines.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;

constexpr const char* kUserFonts = "/var/mobile/Library/UserFonts/";
constexpr const char* kFontFiles = "/var/mobile/Library/UserFonts/FontFiles/";

class HostileFilesTest : public DaemonTestBase {
 protected:
  void SetUp() override {
    DaemonTestBase::SetUp();
    victims_ = dir_ / "victims";
    fs::create_directories(victims_);
    std::ofstream(victims_ / "victim.txt") << "keep";
    std::ofstream(victims_ / "other.txt") << "keep";
    fs::create_directories(root_ / "etc/typhora/apps");
    std::ofstream(root_ / "etc/typhora/apps/keep.plist") << "{}";
    fs::create_directories(root_ / "var/mobile/Library/Preferences");
  }
  fs::path onDisk(const std::string& path) const { return root_ / path.substr(1); }
  void writeFont(const std::string& path) {
    fs::create_directories(onDisk(path).parent_path());
    std::ofstream(onDisk(path)) << "font";
  }
  void setPreferences(const std::string& json) {
    std::ofstream(root_ / "var/mobile/Library/Preferences/com.zorvane.typhorad.plist") << json;
  }
  CommandResult schedule(const std::string& jsonPaths) {
    return ctl({"call", "scheduleFontFilesDeletion:", jsonPaths});
  }
  bool victimsSurvive() const {
    return fs::exists(victims_ / "victim.txt") && fs::exists(victims_ / "other.txt") &&
           fs::exists(root_ / "etc/typhora/apps/keep.plist");
  }

  fs::path victims_;
};

TEST_F(HostileFilesTest, ScheduledDeletionNeverLeavesTheFontDirectories) {
  const std::string shop = std::string(kFontFiles) + "com.example.shop/";
  writeFont(shop + "A.otf");
  writeFont(std::string(kFontFiles) + "com.other/B.otf");
  fs::create_directory_symlink(victims_, onDisk(shop + "outside"));
  fs::create_symlink(victims_ / "other.txt", onDisk(shop + "to-file"));
  fs::create_directory_symlink(victims_, onDisk(std::string(kFontFiles) + "com.evil"));
  setPreferences(R"({"version": 1, "deleteDelay": 0.5})");
  startDaemon();

  auto escapes =
      schedule(R"([")" + std::string(kFontFiles) + R"(../../../../../../victims/victim.txt", ")" +
               kFontFiles + R"(../../../../../etc/typhora/apps", ")" + kFontFiles +
               R"(com.other\u0000/B.otf", ")" + kFontFiles + R"(com.other//B.otf", ")" + shop +
               R"(outside/victim.txt", ")" + kFontFiles + R"(com.evil/victim.txt", ")" + shop +
               R"(to-file", ")" + shop + R"(A.otf"])");
  ASSERT_EQ(escapes.status, 0) << escapes.all;
  ASSERT_TRUE(daemon_->waitForLine("all files deleted.", 30s)) << daemon_->output();
  // The font-files directory itself, and what is above it.
  auto directories = schedule(R"([")" + std::string(kFontFiles) + R"(", ")" + kFontFiles +
                              R"(..", "/var/mobile/Library/UserFonts/FontAssets/.."])");
  ASSERT_EQ(directories.status, 0) << directories.all;
  EXPECT_TRUE(daemon_->waitForLine("no files to delete.", 30s)) << daemon_->output();

  // Paths are refused by their text, one line per call; the links are never followed.
  EXPECT_EQ(daemon_->countLines("scheduleFontFilesDeletion: refused 4 paths"), 1u)
      << daemon_->output();
  EXPECT_EQ(daemon_->countLines("scheduleFontFilesDeletion: refused 3 paths"), 1u);
  EXPECT_EQ(daemon_->countLines("scheduled deletion failed:"), 2u) << daemon_->output();
  EXPECT_TRUE(victimsSurvive());
  EXPECT_TRUE(fs::exists(onDisk(std::string(kFontFiles) + "com.other/B.otf")));
  EXPECT_TRUE(fs::exists(onDisk(std::string(kUserFonts) + "UserFonts.plist")));
  EXPECT_TRUE(fs::is_symlink(onDisk(std::string(kFontFiles) + "com.evil")));
  EXPECT_TRUE(fs::is_directory(onDisk(kFontFiles)));
  // What may go goes: the font, and the link itself rather than the file it names.
  EXPECT_FALSE(fs::exists(onDisk(shop + "A.otf")));
  EXPECT_FALSE(fs::is_symlink(onDisk(shop + "to-file")));
}

TEST_F(HostileFilesTest, ThePendingTableIsBounded) {
  startDaemon();  // the default delay: nothing comes due during the test
  const std::string tooLong = std::string(kFontFiles) + "com.shop/" + std::string(1100, 'x');
  EXPECT_EQ(schedule(R"([")" + tooLong + R"("])").status, 0);
  ASSERT_TRUE(daemon_->waitForLine("path too long", 30s)) << daemon_->output();

  for (int call = 0; call < 9; ++call) {
    std::string paths = "[";
    for (int i = 0; i < 500; ++i) {
      paths += (i > 0 ? ",\"" : "\"") + std::string(kFontFiles) + "com.shop/" +
               std::to_string(call) + "-" + std::to_string(i) + ".otf\"";
    }
    ASSERT_EQ(schedule(paths + "]").status, 0);
  }
  ASSERT_TRUE(daemon_->waitForLine("too many pending deletions", 30s)) << daemon_->output();
  EXPECT_EQ(daemon_->countLines("refused 404 paths"), 1u) << daemon_->output();
  const auto table = ctl({"plist", "show",
                          (root_ / "var/mobile/Library/Preferences/"
                                   "com.zorvane.typhorad.plist")
                              .string()});
  std::size_t entries = 0;
  for (std::size_t at = table.out.find(".otf\""); at != std::string::npos;
       at = table.out.find(".otf\"", at + 1))
    ++entries;
  EXPECT_EQ(entries, 4096u);

  // The daemon goes on serving.
  EXPECT_EQ(ctl({"updating-user-fonts"}).status, 0);
}

TEST_F(HostileFilesTest, ARemovedApplicationTakesItsLinkNotItsTarget) {
  fs::create_directories(root_ / "etc/typhora");
  std::ofstream(root_ / "etc/typhora/typhorad.launch.plist")
      << R"({"LaunchEvents": {"distributedNotification":
              ["com.zorvane.Apploom.applicationUnregistered"]}})";
  fs::create_directories(onDisk(kFontFiles));
  fs::create_directory_symlink(victims_, onDisk(std::string(kFontFiles) + "com.evil"));
  startDaemon();
  ASSERT_TRUE(daemon_->waitForLine("typhorad ready", 30s)) << daemon_->output();

  auto posted =
      ctl({"event", "post", "--distributed", "com.zorvane.Apploom.applicationUnregistered",
           R"({"bundleIDs": ["com.evil"]})"});
  ASSERT_EQ(posted.status, 0) << posted.all;
  ASSERT_TRUE(daemon_->waitForLine("synchroning FontProviders", 30s)) << daemon_->output();
  EXPECT_TRUE(victimsSurvive());
  EXPECT_FALSE(fs::is_symlink(onDisk(std::string(kFontFiles) + "com.evil")));
}

TEST_F(HostileFilesTest, FifosInPlaceOfFilesFreezeNothing) {
  const fs::path userFonts = onDisk(std::string(kUserFonts) + "UserFonts.plist");
  fs::remove(userFonts);
  ASSERT_EQ(mkfifo(userFonts.c_str(), 0644), 0);
  ASSERT_EQ(mkfifo((root_ / "etc/typhora/apps/fifo.plist").c_str(), 0644), 0);
  startDaemon();
  // Start-up reads the user-fonts file; a check-in reads the manifests.
  ASSERT_TRUE(daemon_->waitForLine("typhorad ready", 30s)) << daemon_->output();
  auto checkin = ctl({"call", "checkin:"});
  EXPECT_EQ(checkin.status, 0) << checkin.all << daemon_->output();
  EXPECT_EQ(checkin.out, "[null]\n");
  EXPECT_TRUE(daemon_->waitForLine("not a regular file", 30s)) << daemon_->output();
}

TEST_F(HostileFilesTest, AnUnusableRuntimeDirectoryEndsStartUpWithAMessage) {
  auto result = runCommand({kDaemon, "--root", root_.string(), "--runtime-dir",
                            (dir_ / "missing/deeper").string(), "--log-target", "stderr"},
                           20s);
  EXPECT_EQ(result.status, 1) << result.all;
  EXPECT_THAT(result.all, HasSubstr("cannot open its sockets in runtime directory"));
}

TEST_F(HostileFilesTest, ForgedNewlinesStayInsideOneLogLine) {
  startDaemon();
  auto forged = ctl({"call", "--unchecked", "eraseAllFonts:\nerror forged line\r\x1b[2K"});
  EXPECT_NE(forged.status, 0);
  ASSERT_TRUE(daemon_->waitForLine("forged line", 30s)) << daemon_->output();
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(daemon_->countLines("forged line"), 1u);
  EXPECT_THAT(daemon_->output(), HasSubstr("eraseAllFonts:\\nerror forged line\\r\\x1b[2K"));
}

}  // namespace
}  // namespace typhora::testing
