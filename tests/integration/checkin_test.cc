// Check-in with real processes: applications are copies of typhoractl that the platform's
// manifests sign with their own identifiers and entitlements.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <iterator>

#include "integration/daemon_test_base.h"
#include "platform/value/json_codec.h"

namespace typhora::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class CheckinProcessTest : public DaemonTestBase {
 protected:
  // A sandboxed copy of typhoractl with the user-fonts entitlement `values` (a JSON array).
  std::string install(const std::string& name, const std::string& identifier,
                      const std::string& values) {
    return installApp(name, identifier, R"({"com.zorvane.developer.user-fonts": )" + values + "}");
  }
  CommandResult checkin(const std::string& program) {
    return runCommand({program, "--runtime-dir", runtime_, "call", "checkin:"}, 20s);
  }
};

TEST_F(CheckinProcessTest, EachApplicationGetsWhatItsEntitlementsOpen) {
  const std::string browser = install("browser", "com.example.browser", R"(["font-enumeration"])");
  const std::string shop = install("shop", "com.example.shop", R"(["system-installation"])");
  startDaemon();

  auto enumerated = checkin(browser);
  ASSERT_EQ(enumerated.status, 0) << enumerated.all << daemon_->output();
  EXPECT_THAT(enumerated.out, HasSubstr("com.example.shop/A.otf"));
  EXPECT_THAT(enumerated.out, HasSubstr(R"("extension":{"$data":)"));
  EXPECT_THAT(enumerated.out, Not(HasSubstr("hide-profilefonts")));

  auto provided = checkin(shop);
  ASSERT_EQ(provided.status, 0) << provided.all;
  EXPECT_THAT(provided.out, HasSubstr("com.example.shop/A.otf"));
  EXPECT_THAT(provided.out, HasSubstr(R"("extension.provider":{"$data":)"));
  EXPECT_THAT(provided.out, HasSubstr(R"("hide-profilefonts":true)"));

  // A program no manifest signs has no capability: an absent answer.
  auto unsigned_ = ctl({"call", "checkin:"});
  ASSERT_EQ(unsigned_.status, 0) << unsigned_.all;
  EXPECT_EQ(unsigned_.out, "[null]\n");
}

// Its owner changes a signed program's bytes in place and puts its modification time back: the
// daemon hashes it again and no longer takes it for the application.
TEST_F(CheckinProcessTest, AProgramChangedInPlaceLosesItsIdentity) {
  const std::string shop = install("shop", "com.example.shop", R"(["system-installation"])");
  startDaemon();
  auto signed_ = checkin(shop);
  ASSERT_THAT(signed_.out, HasSubstr(R"("extension.provider")")) << signed_.all;

  struct stat before {};
  ASSERT_EQ(stat(shop.c_str(), &before), 0);
  std::string bytes;
  {
    std::ifstream in(shop, std::ios::binary);
    bytes.assign(std::istreambuf_iterator<char>(in), {});
  }
  // A letter of the usage text: the program still runs.
  const std::size_t at = bytes.find("usage: typhoractl");
  ASSERT_NE(at, std::string::npos);
  const int fd = open(shop.c_str(), O_WRONLY);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(pwrite(fd, "U", 1, static_cast<off_t>(at)), 1);
  close(fd);
  const timespec times[2] = {before.st_atim, before.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, shop.c_str(), times, 0), 0);

  auto changed = checkin(shop);
  ASSERT_EQ(changed.status, 0) << changed.all;
  EXPECT_EQ(changed.out, "[null]\n");
}

// The records every enumerating application receives are encoded once per load and copied into
// each answer: a provider checking in between two enumerating check-ins still gets its own
// filtered records, and after a font change the answer holds the records read anew.
TEST_F(CheckinProcessTest, AnAnswerEncodedOnceServesOnlyItsClassAndItsLoad) {
  auto writeFonts = [this](int others) {
    std::ofstream file(root_ / "var/mobile/Library/UserFonts/UserFonts.plist");
    file << "{";
    for (int i = 0; i < 80; ++i) {
      file << R"("/var/mobile/Library/UserFonts/FontFiles/com.example.shop/S)" << i
           << R"(.otf": {"familyName": {"S-Regular": "S"}}, )";
    }
    for (int i = 0; i < others; ++i) {
      file << R"("/var/mobile/Library/UserFonts/FontFiles/com.example.other/O)" << i
           << R"(.otf": {"familyName": {"O-Regular": "O"}}, )";
    }
    file << R"("/var/mobile/Library/UserFonts/FontFiles/com.example.other/Off.otf": )"
         << R"({"familyName": {"Off-Regular": "Off"}, "disabled": true}})";
  };
  writeFonts(40);
  const std::string browser = install("browser", "com.example.browser", R"(["font-enumeration"])");
  const std::string shop = install("shop", "com.example.shop", R"(["system-installation"])");
  startDaemon();

  const auto first = checkin(browser);
  ASSERT_EQ(first.status, 0) << first.all << daemon_->output();
  EXPECT_THAT(first.out, HasSubstr("com.example.other/O39.otf"));
  EXPECT_THAT(first.out, HasSubstr("com.example.shop/S79.otf"));
  EXPECT_THAT(first.out, Not(HasSubstr("Off.otf")));

  const auto provided = checkin(shop);
  ASSERT_EQ(provided.status, 0) << provided.all;
  EXPECT_THAT(provided.out, HasSubstr("com.example.shop/S79.otf"));
  EXPECT_THAT(provided.out, Not(HasSubstr("com.example.other")));

  const auto again = checkin(browser);
  ASSERT_EQ(again.status, 0) << again.all;
  // The tokens differ between processes; the records follow them, under the last key.
  auto fontsOf = [](const std::string& answer) { return answer.substr(answer.find("fontsInfo")); };
  EXPECT_EQ(fontsOf(again.out), fontsOf(first.out));

  writeFonts(41);
  const auto change = ctl({"call", "fontChanged:reply:",
                           R"({"added": true, "urls": ["file:///var/mobile/Library/UserFonts/)"
                           R"(FontFiles/com.example.other/O40.otf"]})"});
  ASSERT_EQ(change.status, 0) << change.all;
  const auto changed = checkin(browser);
  ASSERT_EQ(changed.status, 0) << changed.all;
  EXPECT_THAT(changed.out, HasSubstr("com.example.other/O40.otf"));
  EXPECT_THAT(changed.out, HasSubstr("com.example.shop/S79.otf"));
}

// The load's client processes each check in, report font changes and request a font; every call
// is answered, each is told of the changes, and the report names the daemon it measured.
TEST_F(CheckinProcessTest, LoadClientsCheckInReportChangesAndMeasureTheDaemon) {
  const std::string browser = install("browser", "com.example.browser", R"(["font-enumeration"])");
  startDaemon();
  auto run =
      runCommand({browser, "--runtime-dir", runtime_, "load", "--clients", "3", "--seconds", "2",
                  "--change-every", "0.5", "--request-every", "1", "--family", "A", "--changed-url",
                  "file:///var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf"},
                 60s);
  ASSERT_EQ(run.status, 0) << run.all;
  const std::optional<Value> report = JsonCodec::decode(run.out);
  ASSERT_TRUE(report.has_value()) << run.out;
  EXPECT_EQ(report->get("errors"), Value(ValueArray{}));
  for (const char* operation : {"checkin", "fontChanged", "requestFonts"}) {
    const Value& figures = report->get("operations").get(operation);
    EXPECT_GT(figures.get("calls").asInt().value_or(0), 0) << operation;
    EXPECT_EQ(figures.get("errors"), Value(0)) << operation;
    EXPECT_LE(figures.get("p50").asDouble().value_or(-1),
              figures.get("max").asDouble().value_or(0));
  }
  // Each client is told of the changes of all three.
  EXPECT_GE(report->get("notifications").asInt().value_or(0),
            report->get("operations").get("fontChanged").get("calls").asInt().value_or(1));
  EXPECT_EQ(report->get("daemon").get("pid"), Value(static_cast<std::int64_t>(daemon_->pid())));
  EXPECT_GT(report->get("daemon").get("threads").asInt().value_or(0), 0);
  EXPECT_GT(report->get("daemon").get("rssKB").at(0).asInt().value_or(0), 0);
}

}  // namespace
}  // namespace typhora::testing
