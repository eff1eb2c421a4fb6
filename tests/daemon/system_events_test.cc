// Removed applications on the fake platform: unregistration one application at a time, ledger
// entries forgotten in the same order, one provider synchronisation after all.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "daemon/typhora_daemon.h"
#include "platform/value/json_codec.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::IsEmpty;
using testing::LogCapture;

constexpr const char* kUnregistered = "com.zorvane.Apploom.applicationUnregistered";

class SystemEventsTest : public ::testing::Test {
 protected:
  void SetUp() override { daemon_->setupForDistributedNotifications(); }
  void post(const char* name, const char* userInfo) {
    std::vector<DictionaryEntry> event{{kLaunchEventNameKey, Value(name)}};
    if (userInfo != nullptr)
      event.emplace_back(kLaunchEventUserInfoKey, *JsonCodec::decode(userInfo));
    ASSERT_TRUE(fake_.launchEvents.post(LaunchEventStreamKind::distributedNotification,
                                        Value(Dictionary(std::move(event)))));
    fake_.mainQueue->runUntilIdle();
    daemon_->mainHandlerQueue().sync([] {});  // the queued ledger removals
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
};

TEST_F(SystemEventsTest, RemovedApplicationsLoseTheirFontsAndLedgerEntriesInOrder) {
  fake_.preferences.setValue(
      "issues", *JsonCodec::decode(R"({"com.a": [], "com.b": ["U/B.otf"], "com.keep": []})"));
  fake_.fontManager.failUnregistering("com.b", "busy");
  LogCapture log;
  post(kUnregistered, R"({"bundleIDs": ["com.a", "com.b", "com.c"]})");
  EXPECT_THAT(fake_.fontManager.unregistered(), ElementsAre("com.a", "com.b", "com.c"));
  EXPECT_EQ(log.count("unregistering com.b error - busy"), 1u);
  EXPECT_EQ(fake_.preferences.value("issues"), *JsonCodec::decode(R"({"com.keep": []})"));
  EXPECT_EQ(fake_.fontManager.providerSynchronizations(), 1);
  EXPECT_EQ(log.count("synchroning FontProviders"), 1u);
}

TEST_F(SystemEventsTest, OnlyWellFormedUnregistrationsDoAnything) {
  post(kUnregistered, R"({})");  // no "bundleIDs": still one synchronisation
  EXPECT_EQ(fake_.fontManager.providerSynchronizations(), 1);

  post("com.zorvane.other", R"({"bundleIDs": ["com.a"]})");
  post(kUnregistered, nullptr);
  post(kUnregistered, R"(["com.a"])");
  EXPECT_THAT(fake_.fontManager.unregistered(), IsEmpty());
  EXPECT_EQ(fake_.fontManager.providerSynchronizations(), 1);
}

}  // namespace
}  // namespace typhora
