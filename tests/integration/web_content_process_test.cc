// Web-content processes between real processes: a signed application starts signed web-content
// processes of its own and has the real typhorad deliver fonts to each.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sstream>

#include "integration/daemon_test_base.h"
#include "platform/value/json_codec.h"

namespace typhora::testing {
namespace {

using ::testing::ElementsAre;

constexpr const char* kA = "/var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf";
constexpr const char* kInvalidated =
    "TYBrisvel checkinForBrisvelProcess connection invalidationHandler.";

// The JSON lines of `text` whose "role" is `role`.
std::vector<Value> linesOf(const std::string& text, const std::string& role) {
  std::vector<Value> lines;
  std::istringstream stream(text);
  for (std::string line; std::getline(stream, line);) {
    auto value = JsonCodec::decode(line, {}, nullptr);
    if (value && value->get("role") == Value(role)) lines.push_back(*value);
  }
  return lines;
}

// The process a sandbox token was issued to: its second field.
std::string tokenPid(const Value& token) {
  const std::string text = *token.asString();
  const auto first = text.find(';');
  return text.substr(first + 1, text.find(';', first + 1) - first - 1);
}

class WebContentProcessTest : public DaemonTestBase {
 protected:
  // A browser that may enumerate fonts runs `children` web-content processes of its own.
  CommandResult browse(int children) {
    const std::string browser =
        installApp("browser", "com.example.browser",
                   R"({"com.zorvane.developer.user-fonts": ["font-enumeration"]})");
    const std::string webContent = installApp("webcontent", "com.example.browser.WebContent", "{}");
    startDaemon();
    return runCommand({browser, "--runtime-dir", runtime_, "web-content-app", "--child", webContent,
                       "--children", std::to_string(children)},
                      30s);
  }
};

TEST_F(WebContentProcessTest, EachWebContentProcessGetsTheApplicationsFontsBeforeItIsAnswered) {
  auto run = browse(2);
  ASSERT_EQ(run.status, 0) << run.all << daemon_->output();

  const auto application = linesOf(run.out, "application");
  const auto received = linesOf(run.out, "web-content");
  ASSERT_EQ(application.size(), 3u) << run.out;
  ASSERT_EQ(received.size(), 2u) << run.out;
  const std::string applicationPid = application[0].get("pid").description();
  for (std::size_t i = 0; i < received.size(); ++i) {
    const Value& fonts = received[i];
    const std::string pid = fonts.get("pid").description();
    // The application's view of the fonts: enumeration, so every enabled font.
    EXPECT_THAT(fonts.get("received").get("fontsInfo").asDictionary()->size(), 1u);
    EXPECT_NE(fonts.get("received").get("fontsInfo").get(kA).asDictionary(), nullptr);
    // Tokens not issued for the application.
    const ValueArray* tokens = fonts.get("tokens").asArray();
    ASSERT_NE(tokens, nullptr);
    ASSERT_FALSE(tokens->empty());
    for (const Value& token : *tokens) EXPECT_NE(tokenPid(token), applicationPid);
    // The application was answered after its web-content process had the fonts.
    EXPECT_EQ(application[i + 1].get("webContentPid").description(), pid) << run.out;
    EXPECT_EQ(application[i + 1].get("replied"), Value(true));
    EXPECT_LT(run.out.find(fonts.get("pid").description()),
              run.out.find("\"replied\":true", run.out.find("\"webContentPid\":" + pid)));
  }
  EXPECT_NE(received[0].get("pid"), received[1].get("pid"));
  // Both web-content processes ended, each taking only its own connection along.
  for (int i = 0; i < 500 && daemon_->countLines(kInvalidated) < 2; ++i)
    std::this_thread::sleep_for(10ms);
  EXPECT_EQ(daemon_->countLines(kInvalidated), 2u) << daemon_->output();
  EXPECT_EQ(daemon_->countLines("TYBrisvel calling ping2"), 2u);
}

// A connection to an endpoint carries the identity of the process listening on it, not the
// connecting one's.
TEST_F(WebContentProcessTest, TheTokensAreIssuedForTheWebContentProcessItself) {
  auto run = browse(1);
  const auto received = linesOf(run.out, "web-content");
  ASSERT_EQ(received.size(), 1u) << run.all;
  for (const Value& token : *received[0].get("tokens").asArray())
    EXPECT_EQ(tokenPid(token), received[0].get("pid").description());
}

TEST_F(WebContentProcessTest, AnApplicationWithoutCheckinCapabilitiesHandsOnNothing) {
  const std::string plain = installApp("plain", "com.example.plain", "{}");
  const std::string webContent = installApp("webcontent", "com.example.plain.WebContent", "{}");
  startDaemon();
  auto run =
      runCommand({plain, "--runtime-dir", runtime_, "web-content-app", "--child", webContent}, 30s);
  ASSERT_EQ(run.status, 0) << run.all << daemon_->output();
  const auto received = linesOf(run.out, "web-content");
  ASSERT_EQ(received.size(), 1u) << run.out;
  EXPECT_TRUE(received[0].get("received").isNull());
  EXPECT_THAT(*received[0].get("tokens").asArray(), ElementsAre());
}

}  // namespace
}  // namespace typhora::testing
