// Font changes told to checked-in applications of every class, between real processes: copies
// of typhoractl signed as enumerating applications, providers and unentitled applications
// print what the daemon sends them.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <sstream>

#include "integration/daemon_test_base.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;

const std::string kFiles = "/var/mobile/Library/UserFonts/FontFiles/";
const std::string kShopA = kFiles + "com.example.shop/A.otf";
const std::string kOtherB = kFiles + "com.example.other/B.otf";
const std::string kOtherOff = kFiles + "com.example.other/Off.otf";

class FontChangeProcessTest : public DaemonTestBase {
 protected:
  fs::path userFonts() const { return root_ / "var/mobile/Library/UserFonts/UserFonts.plist"; }
  // The registry's way: a new file renamed over the old one.
  void replaceUserFonts(const std::string& json) {
    const fs::path temporary = userFonts().string() + ".tmp";
    std::ofstream(temporary) << json;
    fs::rename(temporary, userFonts());
  }
  std::string entitled(const std::string& values) const {
    return R"({"com.zorvane.developer.user-fonts": )" + values + "}";
  }
  // A client of `program` checked in and printing the changes it is told of.
  std::unique_ptr<ChildProcess> watching(const std::string& program) {
    auto client = std::make_unique<ChildProcess>(
        std::vector<std::string>{program, "--runtime-dir", runtime_, "client", "--watch"});
    EXPECT_TRUE(client->waitForLine(R"("event":"checkin")", 20s)) << client->output();
    return client;
  }
  void change(bool added, const std::vector<std::string>& paths) {
    std::string urls;
    for (const std::string& path : paths)
      urls += (urls.empty() ? "\"file://" : ", \"file://") + path + "\"";
    const auto told = ctl({"call", "fontChanged:reply:",
                           std::string(R"({"added": )") + (added ? "true" : "false") +
                               R"(, "urls": [)" + urls + "]}"});
    ASSERT_EQ(told.status, 0) << told.all;
  }
  // The fontsChanged lines `client` printed, once it has printed `count` of them.
  static std::vector<std::string> changesOf(ChildProcess& client, std::size_t count) {
    for (int i = 0; i < 2000 && client.countLines("fontsChanged") < count; ++i)
      std::this_thread::sleep_for(10ms);
    std::vector<std::string> lines;
    std::istringstream output(client.standardOutput());
    for (std::string line; std::getline(output, line);)
      if (line.find("fontsChanged") != std::string::npos) lines.push_back(line);
    return lines;
  }
};

// Two enumerating applications, a sandboxed and an unsandboxed provider of one directory and an
// unentitled application, all checked in, hear of an addition and a removal.
TEST_F(FontChangeProcessTest, EachClassOfClientHearsItsOwnPartOfAChange) {
  replaceUserFonts("{\"" + kShopA +
                   R"(": {"familyName": {"A-Regular": "A"}, "disabled": false}, ")" + kOtherB +
                   R"(": {"familyName": {"B-Regular": "B"}}, ")" + kOtherOff +
                   R"(": {"familyName": {"Off-Regular": "Off"}, "disabled": true}})");
  const std::string enumerating = entitled(R"(["font-enumeration"])");
  const std::string providing = entitled(R"(["system-installation"])");
  const std::string browser = installApp("browser", "com.example.browser", enumerating);
  const std::string reader = installApp("reader", "com.example.reader", enumerating);
  const std::string shop = installApp("shop", "com.example.shop", providing);
  const std::string open = installApp("shop-open", "com.example.shop", providing, false);
  const std::string plain = installApp("plain", "com.example.plain", entitled(R"(["app-usage"])"));
  fs::create_directories(root_ / kFiles.substr(1) / "com.example.shop");
  startDaemon();
  auto browserClient = watching(browser);
  auto readerClient = watching(reader);
  auto shopClient = watching(shop);
  auto openClient = watching(open);
  auto plainClient = watching(plain);

  change(true, {kShopA, kOtherB, kOtherOff, "/tmp/Outside.otf"});
  change(false, {kOtherB});

  const auto browserSaw = changesOf(*browserClient, 2);
  ASSERT_EQ(browserSaw.size(), 2u) << browserClient->output() << daemon_->output();
  // Every URL of a font path, its enabled records as they are cached.
  EXPECT_EQ(browserSaw[0], R"({"added":["file://)" + kShopA + R"(","file://)" + kOtherB +
                               R"(","file://)" + kOtherOff +
                               R"("],"event":"fontsChanged","info":{"fontsInfo":{")" + kOtherB +
                               R"(":{"familyName":{"B-Regular":"B"}},")" + kShopA +
                               R"(":{"disabled":false,"familyName":{"A-Regular":"A"}}}}})");
  EXPECT_EQ(browserSaw[1],
            R"({"event":"fontsChanged","info":{},"removed":["file://)" + kOtherB + R"("]})");
  EXPECT_EQ(changesOf(*readerClient, 2), browserSaw);

  // The sandboxed provider: its own directory's font, as a sandboxed process gets it, and a token.
  const auto shopSaw = changesOf(*shopClient, 2);
  ASSERT_EQ(shopSaw.size(), 2u) << shopClient->output();
  EXPECT_THAT(shopSaw[0], HasSubstr(R"("added":["file://)" + kShopA + R"("])"));
  EXPECT_THAT(shopSaw[0],
              HasSubstr(R"("fontsInfo":{")" + kShopA + R"(":{"familyName":{"A-Regular":"A"}}})"));
  EXPECT_THAT(shopSaw[0], HasSubstr(R"("extension.provider":{"$data":)"));
  EXPECT_EQ(shopSaw[1], browserSaw[1]);

  // The unsandboxed provider can read its directory already: the cached record and no token.
  const auto openSaw = changesOf(*openClient, 2);
  ASSERT_EQ(openSaw.size(), 2u) << openClient->output();
  EXPECT_EQ(openSaw[0], R"({"added":["file://)" + kShopA +
                            R"("],"event":"fontsChanged","info":{"fontsInfo":{")" + kShopA +
                            R"(":{"disabled":false,"familyName":{"A-Regular":"A"}}}}})");
  EXPECT_EQ(openSaw[1], browserSaw[1]);

  // The messages were sent in one pass on one queue: the unentitled client's turn has gone.
  plainClient->kill(SIGTERM);
  plainClient->finishOutput();
  EXPECT_EQ(plainClient->countLines("fontsChanged"), 0u) << plainClient->output();
  EXPECT_THAT(daemon_->output(), HasSubstr("got invalid font path: /tmp/Outside.otf"));
}

// The file stays as the daemon last read it across a notification, then changes to bytes of the
// same size: in place, then by rename. Each change is seen; the unchanged file is not decoded.
TEST_F(FontChangeProcessTest, AChangedFileIsSeenAfterANotificationThatChangedNothing) {
  auto fonts = [](const std::string& family) {
    return "{\"" + kShopA + R"(": {"familyName": {"A-Regular": ")" + family + "\"}}}";
  };
  replaceUserFonts(fonts("Q"));
  // The daemon trusts a file's times only once they are older than the clock's coarsest tick.
  std::this_thread::sleep_for(2100ms);
  const std::string browser =
      installApp("browser", "com.example.browser", entitled(R"(["font-enumeration"])"));
  startDaemon();
  auto client = watching(browser);  // its check-in reads the file

  change(true, {kShopA});
  ASSERT_EQ(changesOf(*client, 1).size(), 1u) << client->output() << daemon_->output();
  EXPECT_THAT(changesOf(*client, 1)[0], HasSubstr(R"({"A-Regular":"Q"})"));
  EXPECT_THAT(daemon_->output(), HasSubstr("UserFonts.plist unchanged since it was read"));

  // Written in place with as many bytes: the same inode, new times.
  std::ofstream(userFonts()) << fonts("R");
  change(true, {kShopA});
  ASSERT_EQ(changesOf(*client, 2).size(), 2u) << client->output();
  EXPECT_THAT(changesOf(*client, 2)[1], HasSubstr(R"({"A-Regular":"R"})"));

  // Once the rewritten file has settled and been read unchanged, renamed over by another.
  std::this_thread::sleep_for(2100ms);
  change(true, {kShopA});
  replaceUserFonts(fonts("S"));
  change(true, {kShopA});
  const auto saw = changesOf(*client, 4);
  ASSERT_EQ(saw.size(), 4u) << client->output();
  EXPECT_THAT(saw[2], HasSubstr(R"({"A-Regular":"R"})"));
  EXPECT_THAT(saw[3], HasSubstr(R"({"A-Regular":"S"})"));

  // Everything else still sees a dropped cache: one drop per notification.
  const auto status = ctl({"status"});
  EXPECT_THAT(status.out, HasSubstr(R"("generation":4)")) << status.all;
}

}  // namespace
}  // namespace typhora::testing
