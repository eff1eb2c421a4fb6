// Font requests between real processes: signed copies of typhoractl ask the real typhorad for
// fonts by name; the view service is a real program the daemon starts.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>

#include "integration/daemon_test_base.h"
#include "platform/value/json_codec.h"

namespace typhora::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr const char* kA = "/var/mobile/Library/UserFonts/FontFiles/com.example.shop/A.otf";
constexpr const char* kB1 = "/var/mobile/Library/UserFonts/FontFiles/com.example.p1/B1.otf";
constexpr const char* kB2 = "/var/mobile/Library/UserFonts/FontFiles/com.example.p2/B2.otf";
constexpr const char* kAppUsage = R"({"com.zorvane.developer.user-fonts": ["app-usage"]})";
constexpr const char* kBlockedSecond =
    "Previous SVFontManagerRequestFonts call has not been resolved.  This call from "
    "\"com.example.second\" is blocked until the previous call is acknowledged by the user.";

Value parsed(const std::string& text) {
  std::string error;
  auto value = JsonCodec::decode(text, {}, &error);
  EXPECT_TRUE(value.has_value()) << error << ": " << text;
  return value.value_or(Value());
}

std::vector<std::string> keys(const Value& dictionary) {
  std::vector<std::string> result;
  if (const Dictionary* entries = dictionary.asDictionary())
    for (const auto& entry : entries->entries()) result.push_back(entry.first);
  return result;
}

class FontRequestsProcessTest : public DaemonTestBase {
 protected:
  void SetUp() override {
    DaemonTestBase::SetUp();
    std::ofstream(root_ / "var/mobile/Library/UserFonts/UserFonts.plist")
        << "{\"" << kA << R"(": {"familyName": {"A-Regular": "A"}}, ")" << kB1
        << R"(": {"familyName": {"B-Regular": "B"}, "disabled": true}, ")" << kB2
        << R"(": {"familyName": {"B-Italic": "B"}, "disabled": true}})";
    // The registry names a provider only for a provider directory that is there.
    for (const char* font : {kA, kB1, kB2}) {
      const fs::path file = root_ / std::string(font).substr(1);
      fs::create_directories(file.parent_path());
      std::ofstream(file) << "font";
    }
  }

  // The view service the daemon starts: `script` runs in sh with the daemon's arguments.
  void viewService(const std::string& script) {
    fs::create_directories(root_ / "etc/typhora/view-services");
    std::ofstream(root_ / "etc/typhora/view-services/com.zorvane.FontInstallViewService.plist")
        << R"({"Program": "/bin/sh", "Arguments": ["-c", )" << JsonCodec::encode(Value(script))
        << R"(, "view-service"]})";
  }
  std::string answering(const std::string& choice) const {
    return "exec " + kCtl + " view-service --choose " + choice + " \"$@\"";
  }

  // `program request-fonts ARGS`, put in the foreground before it execs (its pid stays).
  std::vector<std::string> foregroundRequest(const std::string& program,
                                             std::vector<std::string> args) const {
    const std::string script =
        kCtl + " --root " + root_.string() + " app-state set $$ 8 >/dev/null && exec \"$0\" \"$@\"";
    std::vector<std::string> argv = {
        "/bin/sh", "-c", script, program, "--runtime-dir", runtime_.string(), "request-fonts"};
    argv.insert(argv.end(), args.begin(), args.end());
    return argv;
  }
  Value request(const std::string& program, std::vector<std::string> args) {
    auto result = runCommand(foregroundRequest(program, std::move(args)), 30s);
    EXPECT_EQ(result.status, 0) << result.all << daemon_->output();
    return parsed(result.out);
  }
  Value plist(const fs::path& path) const { return parsed(ctl({"plist", "show", path}).out); }
  Value preferences() const {
    return plist(root_ / "var/mobile/Library/Preferences/com.zorvane.typhorad.plist");
  }
  Value userFonts() const { return plist(root_ / "var/mobile/Library/UserFonts/UserFonts.plist"); }
  // The daemon records and enables after it has answered: waits (up to 10 s) until `settled`.
  static bool eventually(const std::function<bool()>& settled) {
    for (int i = 0; i < 1000; ++i) {
      if (settled()) return true;
      std::this_thread::sleep_for(10ms);
    }
    return settled();
  }
};

TEST_F(FontRequestsProcessTest, AnEnabledFamilyIsAnsweredAtOnceRecordedAndCounted) {
  const std::string reader = installApp("reader", "com.example.reader", kAppUsage);
  startDaemon();
  const Value answer = request(reader, {"--family", "A", "--postscript", "A-Regular"});
  EXPECT_THAT(keys(answer.get("fonts")), ElementsAre(kA));
  // A sandboxed caller gets a token for the file with it.
  EXPECT_NE(answer.get("fonts").get(kA).get("data").asData(), nullptr);
  ASSERT_TRUE(eventually([&] { return !preferences().get("resolved").isNull(); }));
  EXPECT_EQ(preferences().get("resolved"), Value(1));
  EXPECT_TRUE(preferences().get("missed").isNull());
  EXPECT_EQ(preferences().get("issues").get("com.example.reader"),
            Value::array({"U/com.example.shop/A.otf"}));
  std::ifstream analytics(root_ / "var/log/typhora/analytics.jsonl");
  const std::string line{std::istreambuf_iterator<char>(analytics), {}};
  EXPECT_THAT(line, HasSubstr("com.zorvane.font-privacy"));
  EXPECT_THAT(line, HasSubstr("com.example.reader"));
  EXPECT_FALSE(fs::exists(root_ / "etc/typhora/view-services"));
  EXPECT_EQ(daemon_->countLines("requestFonts -  "), 1u) << daemon_->output();
}

TEST_F(FontRequestsProcessTest, TheChosenProviderFilesComeBackEnabledAndWithTheNextCheckin) {
  const std::string reader = installApp("reader", "com.example.reader", kAppUsage);
  viewService(answering("B=com.example.p2"));
  startDaemon();
  const Value answer = request(reader, {"--family", "A", "--family", "B"});
  EXPECT_THAT(keys(answer.get("fonts")), ElementsAre(kB2, kA)) << daemon_->output();

  EXPECT_TRUE(eventually([&] { return userFonts().get(kB2).get("disabled") == Value(false); }));
  EXPECT_EQ(userFonts().get(kB1).get("disabled"), Value(true));
  ASSERT_TRUE(eventually([&] { return !preferences().get("issues").isNull(); }));
  EXPECT_EQ(preferences().get("missed"), Value(1));

  // The application's next check-in gets what it was given, with a token for each file.
  auto checkin = runCommand({reader, "--runtime-dir", runtime_, "call", "checkin:"}, 20s);
  ASSERT_EQ(checkin.status, 0) << checkin.all;
  const Value fonts = parsed(checkin.out).asArray()->at(0).get("fontsInfo");
  EXPECT_THAT(keys(fonts), ElementsAre(kB2, kA));
  EXPECT_NE(fonts.get(kB2).get("data").asData(), nullptr);
}

TEST_F(FontRequestsProcessTest, ASecondRequestWaitsForTheFirstsDialogAndOneSecondMore) {
  const std::string first = installApp("first", "com.example.first", kAppUsage);
  const std::string second = installApp("second", "com.example.second", kAppUsage);
  const fs::path started = dir_ / "dialog-started";
  const fs::path go = dir_ / "go";
  viewService("touch " + started.string() + "; while [ ! -e " + go.string() +
              " ]; do sleep 0.05; done; " + answering("B=com.example.p1"));
  startDaemon();
  ChildProcess firstRequest(foregroundRequest(first, {"--family", "B"}));
  for (int i = 0; i < 1000 && !fs::exists(started); ++i) std::this_thread::sleep_for(10ms);
  ASSERT_TRUE(fs::exists(started)) << daemon_->output();
  ChildProcess secondRequest(foregroundRequest(second, {"--family", "A"}));
  ASSERT_TRUE(daemon_->waitForLine(kBlockedSecond, 30s)) << daemon_->output();
  std::this_thread::sleep_for(300ms);
  EXPECT_EQ(secondRequest.waitFor(0ms), -1) << "answered while the dialog was open";
  std::ofstream(go.string()) << "";

  ASSERT_EQ(firstRequest.waitFor(20s), 0) << firstRequest.output();
  ASSERT_EQ(secondRequest.waitFor(20s), 0) << secondRequest.output();
  const Value firstAnswer = parsed(firstRequest.standardOutput());
  const Value secondAnswer = parsed(secondRequest.standardOutput());
  EXPECT_THAT(keys(firstAnswer.get("fonts")), ElementsAre(kB1));
  EXPECT_THAT(keys(secondAnswer.get("fonts")), ElementsAre(kA));
  // The gate opens one second after the first answer went out, which the first caller received
  // a moment later.
  const double gap =
      *secondAnswer.get("answeredAt").asDouble() - *firstAnswer.get("answeredAt").asDouble();
  EXPECT_GE(gap, 0.95) << daemon_->output();
  std::printf("gap between the two answers: %.3f s\n", gap);
}

TEST_F(FontRequestsProcessTest, AnUnentitledApplicationGetsNothingAndNothingIsRecorded) {
  const std::string installer =
      installApp("installer", "com.example.installer",
                 R"({"com.zorvane.developer.user-fonts": ["system-installation"]})");
  startDaemon();
  EXPECT_EQ(request(installer, {"--family", "A"}).get("fonts"), Value(Dictionary()));
  EXPECT_TRUE(
      daemon_->waitForLine("Application \"com.example.installer\" does not have an "
                           "entitlement to use custom fonts.",
                           5s));
  EXPECT_EQ(request(kCtl, {"--family", "A"}).get("fonts"), Value(Dictionary()));
  EXPECT_TRUE(daemon_->waitForLine(
      "Application \"(null)\" does not have an entitlement to use custom fonts.", 5s));
  EXPECT_TRUE(preferences().get("issues").isNull());
  EXPECT_FALSE(fs::exists(root_ / "var/log/typhora/analytics.jsonl"));
}

TEST_F(FontRequestsProcessTest, AViewServiceThatDiesWithoutAnsweringReleasesTheGate) {
  const std::string reader = installApp("reader", "com.example.reader", kAppUsage);
  viewService("exit 3");
  startDaemon();
  EXPECT_EQ(request(reader, {"--family", "B"}).get("fonts"), Value(Dictionary()));
  const Value next = request(reader, {"--family", "A"});
  EXPECT_THAT(keys(next.get("fonts")), ElementsAre(kA));
  EXPECT_LT(*next.get("seconds").asDouble(), 5.0);
  // Nothing was chosen: nothing was enabled.
  EXPECT_EQ(userFonts().get(kB1).get("disabled"), Value(true));
}

class FontPickerProcessTest : public FontRequestsProcessTest {
 protected:
  void SetUp() override {
    FontRequestsProcessTest::SetUp();
    client_ = installApp("client", "com.example.client", "{}");
    picker_ = installApp("picker", "com.zorvane.Panelor.FontPicker", "{}", false);
    startDaemon();
  }
  CommandResult pick(const std::string& client, const std::string& name) const {
    return runCommand(pickCommand(client, name), 30s);
  }
  std::vector<std::string> pickCommand(const std::string& client, const std::string& name) const {
    return {client,     "--runtime-dir", runtime_, "picker-client",
            "--picker", picker_,         "--name", name};
  }
  std::string client_, picker_;
};

TEST_F(FontPickerProcessTest, TheFamilyReachesTheClientAndAnUnknownNameAnswersFalse) {
  auto delivered = pick(client_, "A-Regular");
  ASSERT_EQ(delivered.status, 0) << delivered.all << daemon_->output();
  EXPECT_THAT(delivered.out, HasSubstr("\"activate\":{\"" + std::string(kA)));
  EXPECT_THAT(delivered.out, HasSubstr("[true]"));
  EXPECT_THAT(delivered.out, HasSubstr("\"activations\":1"));

  auto unknown = pick(client_, "Nope-Regular");
  EXPECT_THAT(unknown.out, HasSubstr("[false]")) << unknown.all;
  EXPECT_THAT(unknown.out, HasSubstr("\"activations\":0"));
  // Every call ends by cutting its connection to the client off, whatever the outcome.
  for (int i = 0; i < 500 && daemon_->countLines("connection invalidated.") < 2; ++i)
    std::this_thread::sleep_for(10ms);
  std::this_thread::sleep_for(200ms);
  EXPECT_EQ(daemon_->countLines("requestFonts:forClient: connection invalidated."), 2u)
      << daemon_->output();
}

// A connection to an endpoint carries the identity of the process listening on it, not the
// connecting one's.
TEST_F(FontPickerProcessTest, TheDeliveryIsRecordedForTheSignedClientOnly) {
  ASSERT_EQ(pick(client_, "A-Regular").status, 0);
  ASSERT_EQ(pick(kCtl, "A-Regular").status, 0);  // a client nobody signed: nothing to name
  eventually([&] { return !preferences().get("issues").isNull(); });
  EXPECT_EQ(preferences().get("issues"),
            Value::dictionary({{"com.example.client", Value::array({"U/com.example.shop/A.otf"})}}))
      << preferences().description();
}

// The daemon's thread that delivers the fonts waits for the client's answer reading the client's
// socket itself: a client that never answers is cut off after its time, and the daemon serves
// everyone else meanwhile.
TEST_F(FontPickerProcessTest, AClientThatNeverAnswersIsCutOffAndOthersAreServedMeanwhile) {
  std::vector<std::string> command = pickCommand(client_, "A-Regular");
  command.push_back("--silent");
  ChildProcess silent(command);
  ASSERT_TRUE(silent.waitForLine("\"activate\"", 20s)) << daemon_->output();
  const auto start = std::chrono::steady_clock::now();
  auto checkin = runCommand({client_, "--runtime-dir", runtime_, "call", "checkin:"}, 20s);
  EXPECT_EQ(checkin.status, 0) << checkin.all;
  EXPECT_LT(std::chrono::steady_clock::now() - start, 5s);
  auto delivered = pick(client_, "A-Regular");  // a second pick, answered, meanwhile
  EXPECT_THAT(delivered.out, HasSubstr("[true]")) << delivered.all;
  silent.wait();
  silent.finishOutput();
  EXPECT_THAT(silent.standardOutput(), HasSubstr("[false]")) << daemon_->output();
}

}  // namespace
}  // namespace typhora::testing
