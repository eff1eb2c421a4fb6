// The font registry changed with typhoractl while the real daemon runs: files are copied under
// the device root, the user-fonts file is rewritten, and a checked-in client hears of the change.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <iterator>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

const std::string kDejaVu = "/usr/share/fonts/truetype/dejavu/";
const std::string kInstalled = "/var/mobile/Library/UserFonts/FontFiles/com.example.fonts/";

std::string contentsOf(const fs::path& file) {
  std::ifstream in(file, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

class FontInstallProcessTest : public DaemonTestBase {
 protected:
  CommandResult font(std::vector<std::string> args) {
    args.insert(args.begin(), {"--root", root_.string(), "font"});
    return ctl(std::move(args));
  }
  // A browser, entitled to every font, checked in and printing the changes it is told of.
  std::unique_ptr<ChildProcess> watchingClient(int count) {
    const std::string browser =
        installApp("browser", "com.example.browser",
                   R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})");
    auto client = std::make_unique<ChildProcess>(std::vector<std::string>{
        browser, "--runtime-dir", runtime_, "client", "--watch", "--count", std::to_string(count)});
    EXPECT_TRUE(client->waitForLine(R"("event":"checkin")", 20s)) << client->output();
    return client;
  }
  fs::path userFonts() const { return root_ / "var/mobile/Library/UserFonts/UserFonts.plist"; }
};

TEST_F(FontInstallProcessTest, ACheckedInClientHearsOfInstalledRemovedAndDisabledFonts) {
  startDaemon();
  auto client = watchingClient(3);

  auto installed = font({"install", "--provider", "com.example.fonts", kDejaVu + "DejaVuSans.ttf",
                         kDejaVu + "DejaVuSerif-Bold.ttf"});
  ASSERT_EQ(installed.status, 0) << installed.all << daemon_->output();
  EXPECT_THAT(installed.out, HasSubstr(R"("notified":true)"));
  EXPECT_EQ(contentsOf(root_ / kInstalled.substr(1) / "DejaVuSans.ttf"),
            contentsOf(kDejaVu + "DejaVuSans.ttf"));
  ASSERT_TRUE(client->waitForLine("file://" + kInstalled + "DejaVuSerif-Bold.ttf", 20s))
      << client->output() << daemon_->output();
  EXPECT_THAT(client->output(), HasSubstr("DejaVuSerif-Bold"));  // with the fonts' records

  auto listed = font({"list", "--provider", "com.example.fonts"});
  ASSERT_EQ(listed.status, 0) << listed.all;
  EXPECT_THAT(listed.out, HasSubstr(R"("DejaVuSans":"DejaVu Sans")"));
  EXPECT_THAT(listed.out, Not(HasSubstr("com.example.shop")));
  EXPECT_THAT(listed.out, Not(HasSubstr(R"("enabled":false)")));  // installed enabled

  auto disabled = font({"disable", kInstalled + "DejaVuSans.ttf"});
  ASSERT_EQ(disabled.status, 0) << disabled.all;
  EXPECT_THAT(font({"list"}).out, HasSubstr(R"("enabled":false)"));

  auto removed = font({"remove", kInstalled + "DejaVuSerif-Bold.ttf"});
  ASSERT_EQ(removed.status, 0) << removed.all;
  EXPECT_FALSE(fs::exists(root_ / kInstalled.substr(1) / "DejaVuSerif-Bold.ttf"));
  EXPECT_EQ(client->waitFor(20s), 0) << client->output();
  client->finishOutput();
  EXPECT_EQ(client->countLines(R"("removed")"), 2u) << client->output();

  // The daemon itself serves what was installed and enabled again, from the rewritten file.
  ASSERT_EQ(font({"enable", kInstalled + "DejaVuSans.ttf"}).status, 0);
  auto checkin = runCommand(
      {(dir_ / "apps/browser").string(), "--runtime-dir", runtime_, "call", "checkin:"}, 20s);
  EXPECT_THAT(checkin.out, HasSubstr(kInstalled + "DejaVuSans.ttf"));
  EXPECT_THAT(checkin.out, Not(HasSubstr("DejaVuSerif-Bold.ttf")));
}

TEST_F(FontInstallProcessTest, WhatIsNoCompleteFontIsRefusedAndLeavesNothingBehind) {
  const fs::path text = dir_ / "notes.ttf";
  std::ofstream(text) << "not a font\n";
  const fs::path truncated = dir_ / "DejaVuSans-Cut.ttf";
  const std::string sans = contentsOf(kDejaVu + "DejaVuSans.ttf");
  std::ofstream(truncated, std::ios::binary) << sans.substr(0, sans.size() - 4096);
  const std::string before = contentsOf(userFonts());

  struct Case {
    std::vector<std::string> files;
    std::string message;
  };
  const std::vector<Case> cases = {
      {{kDejaVu + "DejaVuSans.ttf", text.string()}, "not a font file"},
      {{truncated.string(), kDejaVu + "DejaVuSans-Bold.ttf"}, "truncated"},
      {{(dir_ / "missing.ttf").string()}, "missing.ttf"},
      {{kDejaVu + "DejaVuSans.ttf", kDejaVu + "DejaVuSans.ttf"}, "named twice"},
  };
  for (const Case& c : cases) {
    std::vector<std::string> args = {"install", "--provider", "com.example.fonts"};
    args.insert(args.end(), c.files.begin(), c.files.end());
    auto refused = font(args);
    EXPECT_EQ(refused.status, 1) << c.message;
    EXPECT_THAT(refused.all, HasSubstr(c.message));
    EXPECT_THAT(refused.all, HasSubstr("nothing was installed"));
  }
  EXPECT_EQ(font({"install", "--provider", "..", kDejaVu + "DejaVuSans.ttf"}).status, 1);
  EXPECT_EQ(font({"remove", kInstalled + "DejaVuSans.ttf"}).status, 1);
  EXPECT_TRUE(!fs::exists(root_ / kInstalled.substr(1)) ||
              fs::is_empty(root_ / kInstalled.substr(1)));
  EXPECT_EQ(contentsOf(userFonts()), before);
}

// With no daemon running the registry still changes; the command says the daemon was not told.
TEST_F(FontInstallProcessTest, AProviderIsRemovedWholeWithoutARunningDaemon) {
  auto installed = font({"install", "--provider", "com.example.fonts", kDejaVu + "DejaVuSans.ttf"});
  ASSERT_EQ(installed.status, 0) << installed.all;
  EXPECT_THAT(installed.out, HasSubstr(R"("notified":false)"));
  EXPECT_THAT(installed.all, HasSubstr("not told"));
  auto removed = font({"remove", "--provider", "com.example.fonts"});
  ASSERT_EQ(removed.status, 0) << removed.all;
  EXPECT_FALSE(fs::exists(root_ / kInstalled.substr(1)));
  EXPECT_THAT(font({"list"}).out, Not(HasSubstr("com.example.fonts")));
  EXPECT_THAT(font({"list"}).out, HasSubstr("com.example.shop/A.otf"));
}

// Installers running at once each read the user-fonts file, add their faces and write it back: none
// may write over another's change with its older copy.
TEST_F(FontInstallProcessTest, InstallersRunningAtOnceKeepEachOthersFonts) {
  const std::vector<std::string> faces = {"DejaVuSans.ttf",         "DejaVuSans-Bold.ttf",
                                          "DejaVuSans-Oblique.ttf", "DejaVuSansCondensed.ttf",
                                          "DejaVuSansMono.ttf",     "DejaVuSerif.ttf",
                                          "DejaVuSerif-Bold.ttf",   "DejaVuSansMono-Bold.ttf"};
  std::vector<std::unique_ptr<ChildProcess>> installers;
  for (std::size_t i = 0; i < faces.size(); ++i) {
    installers.push_back(std::make_unique<ChildProcess>(std::vector<std::string>{
        kCtl, "--runtime-dir", runtime_, "--root", root_.string(), "font", "install", "--provider",
        "com.example.p" + std::to_string(i), kDejaVu + faces[i]}));
  }
  for (auto& installer : installers) EXPECT_EQ(installer->wait(), 0) << installer->output();
  const std::string listed = font({"list"}).out;
  for (std::size_t i = 0; i < faces.size(); ++i) {
    EXPECT_THAT(listed, HasSubstr("com.example.p" + std::to_string(i) + "/" + faces[i]));
  }
}

}  // namespace
}  // namespace typhora::testing
