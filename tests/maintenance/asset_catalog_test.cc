// The block list from the asset catalog, loaded on asset notifications, and the catalog-update
// activity, on the fake platform.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "daemon/typhora_daemon.h"
#include "platform/value/json_codec.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using testing::FakePlatform;
using testing::LogCapture;

constexpr const char* kAssetType = "com.zorvane.Cargell.ScrivaneAssets";
constexpr const char* kNewAsset = "com.zorvane.Cargell.ScrivaneAssets.cg.new-asset-installed";
constexpr const char* kActivity = "com.zorvane.typhorad.check-asset-update";

Value json(const char* text) {
  return *JsonCodec::decode(text);
}

class BlockListTest : public ::testing::Test {
 protected:
  void SetUp() override { daemon_->setupForBlacklistUpdatedNotification(); }

  // Posts a system notification, runs the main queue, and waits for the loads it started.
  void notify(const std::string& name) {
    fake_.launchEvents.post(LaunchEventStreamKind::systemNotification,
                            Value::dictionary({{kLaunchEventNameKey, name}}));
    fake_.mainQueue->runUntilIdle();
    daemon_->assetHandlerQueue().sync([] {});
  }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
};

TEST_F(BlockListTest, AssetNotificationsLoadTheFontAccessFragmentsInCatalogOrder) {
  fake_.assetCatalog.setAssets(
      kAssetType,
      {
          json(
              R"({"_CompatibilityVersion": "1", "type": "FontAccess", "FontAccess": {"com.a": ["1"]}})"),
          json(R"({"_CompatibilityVersion": "1", "type": "FontAccess"})"),
          json(
              R"({"_CompatibilityVersion": "2", "type": "FontAccess", "FontAccess": {"com.b": ["1"]}})"),
          json(
              R"({"_CompatibilityVersion": "1", "type": "FontAccess", "FontAccess": {"com.a": ["2"]}})"),
      });
  EXPECT_TRUE(daemon_->blacklistInfo().isNull());  // nothing loaded at start-up

  notify("com.zorvane.other");
  notify("");
  EXPECT_EQ(fake_.assetCatalog.queries(), 0);

  notify(kNewAsset);
  EXPECT_EQ(fake_.assetCatalog.queries(), 1);
  EXPECT_EQ(daemon_->blacklistInfo(), json(R"([{"com.a": ["1"]}, {"com.a": ["2"]}])"));

  // Both fragments count.
  fake_.appRegistry.setVersion("com.a", "2");
  EXPECT_FALSE(daemon_->isIdentifierAllowed("com.a"));

  // A later load that finds nothing clears the list.
  fake_.assetCatalog.setAssets(kAssetType, {});
  notify("com.zorvane.Cargell.ScrivaneAssets.cg.cached-metadata-updated");
  EXPECT_EQ(daemon_->blacklistInfo(), Value(ValueArray{}));
  EXPECT_TRUE(daemon_->isIdentifierAllowed("com.a"));
}

TEST_F(BlockListTest, TheActivityDownloadsTheCatalogOnlyWhenItRuns) {
  ASSERT_TRUE(fake_.activities.isRegistered(kActivity));
  fake_.activities.call(kActivity, ScheduledActivityState::checkIn);
  EXPECT_TRUE(fake_.assetCatalog.downloads().empty());
  fake_.activities.call(kActivity, ScheduledActivityState::run);
  for (int i = 0; i < 1000 && fake_.assetCatalog.downloads().empty(); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  auto downloads = fake_.assetCatalog.downloads();
  ASSERT_EQ(downloads.size(), 1u);
  EXPECT_EQ(downloads[0].assetType, kAssetType);
  EXPECT_TRUE(downloads[0].discretionary);

  LogCapture log;
  fake_.assetCatalog.completeDownload(0, 3);
  EXPECT_EQ(log.count("asset catalog updated. (3)"), 1u);
}

}  // namespace
}  // namespace typhora
