// Font requests on the fake platform and the manual clock: the entitlement test, the gate and
// its release one second after each answer, the dialog's completion and its provider choice,
// and the ways a dialog ends without the user.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "platform/dispatch/semaphore.h"
#include "platform/value/json_codec.h"
#include "requests/missing_fonts_dialog_handler.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using testing::FakeIpcConnection;
using testing::FakeIpcEndpoint;
using testing::FakePlatform;
using ::testing::IsEmpty;
using testing::LogCapture;

constexpr const char* kA = "/var/mobile/Library/UserFonts/FontFiles/com.a/A.otf";
constexpr const char* kB1 = "/var/mobile/Library/UserFonts/FontFiles/com.p1/B1.otf";
constexpr const char* kB2 = "/var/mobile/Library/UserFonts/FontFiles/com.p2/B2.otf";
constexpr const char* kBlocked =
    "Previous SVFontManagerRequestFonts call has not been resolved.  This call from "
    "\"com.example.app%d\" is blocked until the previous call is acknowledged by the user.";

Value json(const std::string& text) {
  return *JsonCodec::decode(text);
}

ValueArray families(std::initializer_list<const char*> names) {
  ValueArray requests;
  for (const char* name : names)
    requests.push_back(Value::dictionary({{kSVFontFamilyNameAttribute, name}}));
  return requests;
}

std::vector<std::string> keys(const Value& dictionary) {
  std::vector<std::string> result;
  for (const auto& entry : dictionary.asDictionary()->entries()) result.push_back(entry.first);
  return result;
}

class FontRequestsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist",
                               std::string(R"({")") + kA + R"(": {"familyName": {"A-R": "A"}}, ")" +
                                   kB1 + R"(": {"familyName": {"B-R": "B"}, "disabled": true}, ")" +
                                   kB2 + R"(": {"familyName": {"B-I": "B"}, "disabled": true}})");
    for (const char* provider : {"com.a", "com.p1", "com.p2"})
      fake_.fontManager.setProviderDirectory(provider, provider);
  }

  // Caller `n`: pid 40 + n, signed "com.example.app<n>" with `entitlement`, in the foreground.
  AuditToken caller(int n, const char* entitlement = R"(["app-usage"])") {
    AuditToken token{.pid = 40 + n, .startTime = 7, .exeInode = 9};
    fake_.codeSigning.setRecord(
        token, "com.example.app" + std::to_string(n),
        json(std::string(R"({"com.zorvane.developer.user-fonts": )") + entitlement + "}"));
    fake_.appStates.setState(token.pid, kApplicationStateForegroundRunning);
    return token;
  }

  // Sends a request as `token` would over its own connection; answers the request's number.
  std::size_t request(const AuditToken& token, const ValueArray& requests) {
    auto connection = std::make_shared<FakeIpcConnection>(token);
    const std::size_t n = connections_.size();
    connections_.push_back(connection);
    {
      std::lock_guard lock(mutex_);
      replies_.emplace_back();
    }
    IpcConnection::CurrentScope scope(connection);
    daemon_->requestFonts(requests, [this, n](std::vector<Value> reply) {
      std::lock_guard lock(mutex_);
      replies_[n].push_back(reply.at(0));
      replied_.signal();
    });
    return n;
  }
  std::vector<Value> replies(std::size_t n) {
    std::lock_guard lock(mutex_);
    return replies_[n];
  }
  // Waits (real time) for the next reply, then for the daemon's queue to finish its job.
  bool waitForReply() {
    const bool got = replied_.waitFor(5s);
    daemon_->mainHandlerQueue().sync([] {});
    return got;
  }
  // Moves the manual clock and runs what became due on the main queue.
  void advance(std::chrono::milliseconds by) {
    fake_.clock.advance(by);
    fake_.mainQueue->runUntilIdle();
  }
  std::shared_ptr<FakeIpcConnection> viewService() {
    auto activations = fake_.remoteAlert.activations();
    auto endpoint =
        std::dynamic_pointer_cast<const FakeIpcEndpoint>(activations.back().configuration.endpoint);
    return endpoint->listener()->connect();
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
  std::vector<std::shared_ptr<FakeIpcConnection>> connections_;
  std::mutex mutex_;
  std::vector<std::vector<Value>> replies_;
  Semaphore replied_;
};

TEST_F(FontRequestsTest, OneRequestPassesTheGateAtATimeInOrderEachOneSecondAfterTheLast) {
  LogCapture log;
  request(caller(1), families({"A"}));
  request(caller(2), families({"A"}));
  request(caller(3), families({"A"}));
  ASSERT_TRUE(waitForReply());
  EXPECT_EQ(daemon_->requestFontsGate().waiting(), 3u);
  EXPECT_EQ(log.count(formatLog(kBlocked, {2})), 1u);
  EXPECT_EQ(log.count(formatLog(kBlocked, {3})), 1u);
  EXPECT_THAT(keys(replies(0).at(0)), ElementsAre(kA));

  advance(999ms);
  EXPECT_FALSE(replied_.waitFor(50ms));
  EXPECT_THAT(replies(1), IsEmpty());
  advance(1ms);
  ASSERT_TRUE(waitForReply());
  EXPECT_EQ(replies(1).size(), 1u);
  EXPECT_THAT(replies(2), IsEmpty());
  advance(1s);
  ASSERT_TRUE(waitForReply());
  EXPECT_EQ(replies(2).size(), 1u);
  advance(1s);
  EXPECT_EQ(daemon_->requestFontsGate().waiting(), 0u);

  // Each answered request was recorded for its caller and counted once as resolved.
  EXPECT_EQ(fake_.preferences.value("resolved"), Value(3));
  EXPECT_EQ(fake_.preferences.value("missed"), Value());
  EXPECT_THAT(daemon_->issuedFontFilePathsForIdentifier("com.example.app2"), ElementsAre(kA));
  EXPECT_EQ(fake_.analytics.events().size(), 3u);
}

TEST_F(FontRequestsTest, AnUnentitledCallerGetsAnEmptyAnswerAndTheGateIsNotTouched) {
  LogCapture log;
  const AuditToken plain = caller(1, R"(["system-installation"])");
  request(plain, families({"A"}));
  const AuditToken anonymous = caller(2);
  fake_.codeSigning.setRecord(anonymous, std::nullopt, json(R"({
      "com.zorvane.developer.user-fonts": ["app-usage"]})"));
  request(anonymous, families({"A"}));
  EXPECT_THAT(replies(0), ElementsAre(Value(Dictionary())));
  EXPECT_THAT(replies(1), ElementsAre(Value(Dictionary())));
  EXPECT_EQ(log.count("Application \"com.example.app1\" does not have an entitlement to use "
                      "custom fonts."),
            1u);
  EXPECT_EQ(log.count("Application \"(null)\" does not have an entitlement to use custom fonts."),
            1u);
  EXPECT_EQ(daemon_->requestFontsGate().waiting(), 0u);
  EXPECT_THAT(fake_.analytics.events(), IsEmpty());
  EXPECT_EQ(fake_.preferences.value("issues"), Value());
}

TEST_F(FontRequestsTest, TheChosenProviderFilesAreAddedAndEnabledAndAnswersAfterTheFirstDoNothing) {
  const AuditToken app = caller(1, R"(["font-enumeration"])");
  request(app, families({"A", "B", "Nope"}));
  daemon_->mainHandlerQueue().sync([] {});
  ASSERT_EQ(fake_.remoteAlert.activations().size(), 1u);
  EXPECT_THAT(replies(0), IsEmpty());

  auto service = viewService();
  const Value answer = json(R"([{"uniqueID": "B", "installProvider": "com.p2"},
                                {"installProvider": "com.p1"}, {"uniqueID": "A"}])");
  service->deliver(op::kDoneWithMissingFonts, {answer});
  service->deliver(op::kDoneWithMissingFonts, {json(R"([{"uniqueID": "B",
                                                        "installProvider": "com.p1"}])")});
  service->invalidate();
  fake_.remoteAlert.activations().back().ended();
  ASSERT_TRUE(waitForReply());
  advance(5s);  // past the gate's release and the ended view service's grace
  daemon_->mainHandlerQueue().sync([] {});

  ASSERT_EQ(replies(0).size(), 1u);
  EXPECT_THAT(keys(replies(0)[0]), ElementsAre(kA, kB2));
  ASSERT_EQ(fake_.fontManager.enableCalls().size(), 1u);
  EXPECT_THAT(fake_.fontManager.enableCalls()[0].first, ElementsAre(std::string("file://") + kB2));
  EXPECT_TRUE(fake_.fontManager.enableCalls()[0].second);
  EXPECT_THAT(daemon_->issuedFontFilePathsForIdentifier("com.example.app1"), ElementsAre(kA, kB2));
  EXPECT_EQ(daemon_->requestFontsGate().waiting(), 0u);
  EXPECT_EQ(fake_.preferences.value("missed"), Value(1));
  EXPECT_EQ(fake_.preferences.value("resolved"), Value(1));
  EXPECT_EQ(fake_.analytics.events().at(0).second,
            json(R"({"misses": 1, "name": "com.example.app1", "resolved": 1, "suggestions": 1})"));
}

TEST_F(FontRequestsTest, ADialogThatCannotBeShownOrWhoseViewServiceEndsAnswersNothingChosen) {
  LogCapture log;
  // The view service cannot be started: nothing is chosen once its grace has passed.
  fake_.remoteAlert.failActivations();
  request(caller(1), families({"A", "B"}));
  daemon_->mainHandlerQueue().sync([] {});
  EXPECT_THAT(replies(0), IsEmpty());
  advance(MissingFontsDialogHandler::kEndedGrace);
  ASSERT_TRUE(waitForReply());
  EXPECT_THAT(keys(replies(0).at(0)), ElementsAre(kA));

  // No listener for the answer (no socket pair could be made): nothing chosen, at once.
  fake_.ipc.failAnonymousListeners();
  request(caller(2), families({"B"}));
  advance(1s);
  ASSERT_TRUE(waitForReply());
  EXPECT_THAT(replies(1), ElementsAre(Value(Dictionary())));
  EXPECT_TRUE(log.contains("no listener for the view service's answer"));
  advance(1s);
  EXPECT_EQ(daemon_->requestFontsGate().waiting(), 0u);
  EXPECT_THAT(fake_.fontManager.enableCalls(), IsEmpty());
}

TEST_F(FontRequestsTest, ARequestWhoseCallerLeftWhileItWaitedIsDroppedAndFreesTheGate) {
  request(caller(1), families({"B"}));
  request(caller(2), families({"A"}));
  request(caller(3), families({"A"}));
  daemon_->mainHandlerQueue().sync([] {});
  connections_[1]->invalidate();
  viewService()->deliver(op::kDoneWithMissingFonts, {json("[]")});
  ASSERT_TRUE(waitForReply());
  advance(1s);
  ASSERT_TRUE(waitForReply());  // the third, at once: the second is not resolved at all
  EXPECT_THAT(replies(1), IsEmpty());
  EXPECT_EQ(replies(2).size(), 1u);
  EXPECT_EQ(fake_.analytics.events().size(), 2u);
  advance(1s);
  EXPECT_EQ(daemon_->requestFontsGate().waiting(), 0u);
}

}  // namespace
}  // namespace typhora
