// Launch events, background activities and the asset catalog of the Linux platform, driven in
// process: a manual queue and clock for the schedules, a temporary device root for the files.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "platform/dispatch/manual_clock.h"
#include "platform/dispatch/semaphore.h"
#include "platform/linux/events/launch_configuration.h"
#include "platform/linux/events/linux_asset_catalog.h"
#include "platform/linux/events/linux_launch_event_stream.h"
#include "platform/linux/events/linux_scheduled_activity.h"
#include "platform/value/json_codec.h"
#include "support/fake_system_notify.h"
#include "support/log_capture.h"
#include "support/temp_directory.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using testing::TempDirectory;

Value json(const std::string& text) {
  return *JsonCodec::decode(text);
}

TEST(LaunchConfigurationTest, ListsNamesPerStreamAndActivityIntervals) {
  LaunchConfiguration configuration(json(R"({
      "LaunchEvents": {"distributedNotification": ["a.removed", 7],
                       "systemNotification": ["a.ping"]},
      "Activities": {"a.daily": {"Interval": 86400}, "a.never": {"Interval": -1},
                     "a.odd": "hourly"}})"));
  EXPECT_TRUE(configuration.delivers(LaunchEventStreamKind::distributedNotification, "a.removed"));
  EXPECT_FALSE(configuration.delivers(LaunchEventStreamKind::systemNotification, "a.removed"));
  EXPECT_TRUE(configuration.delivers(LaunchEventStreamKind::systemNotification, "a.ping"));
  EXPECT_EQ(configuration.activityInterval("a.daily"), 86400.0);
  EXPECT_EQ(configuration.activityInterval("a.never"), std::nullopt);
  EXPECT_EQ(configuration.activityInterval("a.odd"), std::nullopt);

  TempDirectory root;
  testing::LogCapture log;
  root.write("etc/typhora/typhorad.launch.plist", "{broken");
  LaunchConfiguration broken(root.path());
  EXPECT_FALSE(broken.delivers(LaunchEventStreamKind::systemNotification, "a.ping"));
  EXPECT_TRUE(log.contains("launch configuration"));
}

TEST(LinuxLaunchEventStreamTest, EventsWaitForTheHandlerAndKeepTheirOrder) {
  LaunchConfiguration configuration(json(R"({"LaunchEvents": {
      "distributedNotification": ["a.removed"], "systemNotification": ["a.one", "a.two"]}})"));
  LinuxLaunchEventStream streams(configuration);
  auto queue = SerialQueue::createManual("test.events");

  EXPECT_TRUE(streams.deliver(LaunchEventStreamKind::systemNotification, "a.one", Value()));
  EXPECT_FALSE(streams.deliver(LaunchEventStreamKind::systemNotification, "a.other", Value()));
  EXPECT_FALSE(streams.deliver(LaunchEventStreamKind::distributedNotification, "a.one", Value()));
  EXPECT_TRUE(streams.deliver(LaunchEventStreamKind::distributedNotification, "a.removed",
                              json(R"({"bundleIDs": ["x"]})")));

  std::vector<Value> system, distributed;
  streams.setEventHandler(LaunchEventStreamKind::systemNotification, *queue,
                          [&](const Value& event) { system.push_back(event); });
  EXPECT_TRUE(streams.deliver(LaunchEventStreamKind::systemNotification, "a.two", Value()));
  queue->runUntilIdle();
  EXPECT_THAT(system, ElementsAre(json(R"({"Name": "a.one"})"), json(R"({"Name": "a.two"})")));

  streams.setEventHandler(LaunchEventStreamKind::distributedNotification, *queue,
                          [&](const Value& event) { distributed.push_back(event); });
  queue->runUntilIdle();
  EXPECT_THAT(distributed,
              ElementsAre(json(R"({"Name": "a.removed", "UserInfo": {"bundleIDs": ["x"]}})")));
}

TEST(LinuxLaunchEventStreamTest, EventsWaitingForAHandlerAreBounded) {
  LaunchConfiguration configuration(json(R"({"LaunchEvents": {"systemNotification": ["a"]}})"));
  LinuxLaunchEventStream streams(configuration);
  testing::LogCapture log;
  for (std::size_t i = 0; i < LinuxLaunchEventStream::kMaxWaitingEvents; ++i)
    ASSERT_TRUE(streams.deliver(LaunchEventStreamKind::systemNotification, "a", Value()));
  EXPECT_FALSE(streams.deliver(LaunchEventStreamKind::systemNotification, "a", Value()));
  EXPECT_TRUE(log.contains("no handler yet"));
}

TEST(LinuxScheduledActivityTest, ChecksInThenRunsEveryIntervalAndOnRequest) {
  ManualClock clock;
  auto queue = SerialQueue::createManual("test.activities", &clock);
  LaunchConfiguration configuration(json(R"({"Activities": {"a.hourly": {"Interval": 3600}}})"));
  LinuxScheduledActivity activities(configuration, *queue);
  std::vector<std::string> calls;
  auto record = [&calls](const std::string& name) {
    return [&calls, name](ScheduledActivityState state) {
      calls.push_back(name + (state == ScheduledActivityState::checkIn ? ":check-in" : ":run"));
    };
  };
  activities.registerActivity("a.hourly", record("hourly"));
  activities.registerActivity("a.manual", record("manual"));
  queue->runUntilIdle();
  EXPECT_THAT(calls, ElementsAre("hourly:check-in", "manual:check-in"));

  clock.advance(3599s);
  queue->runUntilIdle();
  EXPECT_EQ(calls.size(), 2u);
  clock.advance(1s);
  queue->runUntilIdle();
  clock.advance(3600s);
  queue->runUntilIdle();
  EXPECT_THAT(calls, ElementsAre("hourly:check-in", "manual:check-in", "hourly:run", "hourly:run"));

  EXPECT_TRUE(activities.runNow("a.manual"));
  EXPECT_FALSE(activities.runNow("a.unknown"));
  queue->runUntilIdle();
  EXPECT_EQ(calls.back(), "manual:run");
}

class LinuxAssetCatalogTest : public ::testing::Test {
 protected:
  long download(const std::string& type) {
    long result = -1;
    Semaphore done;
    catalog_.downloadCatalog(type, true, [&](long r) {
      result = r;
      done.signal();
    });
    done.wait();
    return result;
  }

  TempDirectory root_;
  testing::FakeSystemNotify notify_;
  LinuxAssetCatalog catalog_{root_.path(), notify_};
};

TEST_F(LinuxAssetCatalogTest, QueriesKeepMatchingAssetsInCatalogOrder) {
  root_.write("var/typhora/assets/a.fonts/catalog.plist", R"([
      {"type": "FontAccess", "_CompatibilityVersion": "1", "FontAccess": {"x": ["1"]}},
      {"type": "FontAccess", "_CompatibilityVersion": "2"},
      {"type": "Other", "_CompatibilityVersion": "1"},
      "not a dictionary",
      {"type": "FontAccess", "_CompatibilityVersion": 1},
      {"type": "FontAccess", "_CompatibilityVersion": "1", "FontAccess": {"y": ["2"]}}])");
  auto found =
      catalog_.queryMetadata("a.fonts", {{"_CompatibilityVersion", "1"}, {"type", "FontAccess"}});
  ASSERT_EQ(found.size(), 2u);
  EXPECT_EQ(found[0].get("FontAccess"), json(R"({"x": ["1"]})"));
  EXPECT_EQ(found[1].get("FontAccess"), json(R"({"y": ["2"]})"));

  testing::LogCapture log;
  EXPECT_TRUE(catalog_.queryMetadata("a.missing", {}).empty());
  root_.write("var/typhora/assets/a.fonts/catalog.plist", R"({"not": "an array"})");
  EXPECT_TRUE(catalog_.queryMetadata("a.fonts", {}).empty());
  EXPECT_TRUE(catalog_.queryMetadata("../etc", {}).empty());
  EXPECT_TRUE(log.contains("asset catalog a.fonts"));
}

TEST_F(LinuxAssetCatalogTest, DownloadsReplaceTheCatalogAndAnnounceIt) {
  EXPECT_EQ(download("a.fonts"), LinuxAssetCatalog::kNoSource);
  const std::string source = root_.write("source/catalog.json", R"([{"type": "FontAccess"}])");
  const std::string broken = root_.write("source/broken.json", R"({"type": "FontAccess"})");
  root_.write("etc/typhora/asset-sources.plist",
              R"({"a.fonts": ")" + source + R"(", "a.broken": ")" + broken + R"("})");
  EXPECT_EQ(download("a.broken"), LinuxAssetCatalog::kBadSource);
  EXPECT_EQ(download(".."), LinuxAssetCatalog::kBadAssetType);
  EXPECT_TRUE(notify_.posted().empty());

  EXPECT_EQ(download("a.fonts"), LinuxAssetCatalog::kDownloaded);
  EXPECT_THAT(catalog_.queryMetadata("a.fonts", {{"type", "FontAccess"}}),
              ElementsAre(json(R"({"type": "FontAccess"})")));
  EXPECT_THAT(notify_.posted(), ElementsAre("a.fonts.cg.cached-metadata-updated"));
}

}  // namespace
}  // namespace typhora
