// Scheduled font-file deletion on the fake platform and its manual clock: delays, the timer's
// arming rules, deletion runs, and start-up with pending entries.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "daemon/typhora_daemon.h"
#include "ipc/interface_descriptions.h"
#include "support/fake_platform.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::IsEmpty;
using testing::LogCapture;

const std::string kFiles = "/var/mobile/Library/UserFonts/FontFiles/";
const std::string kAssets = "/var/mobile/Library/UserFonts/FontAssets/";
const std::string kStore = "/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/";

class ScheduledDeletionTest : public ::testing::Test {
 protected:
  // Lets the deletion queue finish what it was given, including what that work queued.
  void settle() {
    for (int i = 0; i < 3; ++i) daemon_->scheduledFontDeletionQueue().sync([] {});
  }
  void advance(std::chrono::seconds by) {
    settle();  // the timer is armed on the deletion queue
    fake_.clock.advance(by);
    settle();
  }
  OneShotTimer::State timerState() {
    OneShotTimer::State state = OneShotTimer::State::None;
    daemon_->scheduledFontDeletionQueue().sync([&] {
      if (auto timer = daemon_->scheduledFontDeletionTimer()) state = timer->state();
    });
    return state;
  }
  // Seconds from now to the timer's deadline, and its leeway.
  std::pair<double, double> timerDeadline() {
    auto deadline = fake_.clock.nextDeadline().value_or(Duration::zero()) - fake_.clock.uptime();
    auto leeway = fake_.clock.nextLeeway().value_or(Duration::zero());
    return {std::chrono::duration<double>(deadline).count(),
            std::chrono::duration<double>(leeway).count()};
  }
  Value dueIn(double seconds) { return Value(Date{fake_.clock.now().secondsSince1970 + seconds}); }
  void setTable(std::vector<DictionaryEntry> entries) {
    fake_.preferences.setValue("delete", Value(Dictionary(std::move(entries))));
  }
  Value table() { return fake_.preferences.value("delete"); }

  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
};

TEST_F(ScheduledDeletionTest, SchedulingRecordsDueDatesAndArmsTheTimerOnce) {
  daemon_->scheduleFontFilesDeletion({});
  settle();
  EXPECT_EQ(fake_.preferences.writes(), 0);
  EXPECT_EQ(timerState(), OneShotTimer::State::None);

  daemon_->scheduleFontFilesDeletion({kFiles + "a/A.otf", kAssets + "S/S.ttf", "/tmp/x.ttf"});
  settle();
  EXPECT_EQ(table(), Value::dictionary({{kAssets + "S/S.ttf", dueIn(10800)},
                                        {kFiles + "a/A.otf", dueIn(10800)}}));
  EXPECT_EQ(timerState(), OneShotTimer::State::Pending);
  EXPECT_EQ(timerDeadline(), std::make_pair(13500.0, 2700.0));

  // A pending timer keeps its deadline; the same path again keeps only the later date.
  advance(100s);
  daemon_->scheduleFontFilesDeletion({kFiles + "a/A.otf"});
  settle();
  EXPECT_EQ(table().get(kFiles + "a/A.otf"), dueIn(10800));
  EXPECT_EQ(timerDeadline(), std::make_pair(13400.0, 2700.0));

  // Paths outside both directories still rewrite the table.
  const int synchronizations = fake_.preferences.synchronizations();
  daemon_->scheduleFontFilesDeletion({"/elsewhere.ttf"});
  settle();
  EXPECT_EQ(fake_.preferences.synchronizations(), synchronizations + 1);
}

TEST_F(ScheduledDeletionTest, TheDelayComesFromThePreferenceOrTheBuild) {
  fake_.buildVariant.setInternal(true);
  daemon_->scheduleFontFilesDeletion({kFiles + "a/A.otf"});
  settle();
  EXPECT_EQ(table().get(kFiles + "a/A.otf"), dueIn(600));
  EXPECT_THAT(fake_.buildVariant.askedSubsystems(), ElementsAre("com.zorvane.Typhora"));

  fake_.preferences.setValue("deleteDelay", Value(90.9));
  daemon_->scheduleFontFilesDeletion({kFiles + "a/B.otf"});
  settle();
  EXPECT_EQ(table().get(kFiles + "a/B.otf"), dueIn(90));

  // Under a second: due now, and the existing timer is armed to fire at once, with 60 s leeway.
  fake_.fileSystem.writeFile(kFiles + "a/C.otf", "c");
  fake_.preferences.setValue("deleteDelay", Value(0.5));
  daemon_->scheduleFontFilesDeletion({kFiles + "a/C.otf"});
  settle();
  EXPECT_EQ(timerDeadline(), std::make_pair(0.0, 60.0));
  advance(0s);
  EXPECT_FALSE(fake_.fileSystem.fileExists(kFiles + "a/C.otf"));
}

TEST_F(ScheduledDeletionTest, ARunDeletesWhatIsNearlyDueAndArmsForTheRest) {
  for (const char* name : {"a/Now.otf", "a/Soon.otf", "a/Later.otf", "b/Only.otf"})
    fake_.fileSystem.writeFile(kFiles + name, "x");
  setTable({{kFiles + "a/Now.otf", dueIn(-5)},
            {kFiles + "a/Soon.otf", dueIn(179.9)},
            {kFiles + "a/Later.otf", dueIn(180)},
            {kFiles + "b/Only.otf", dueIn(0)},
            {kFiles + "bad.otf", Value("not a date")},
            {"/elsewhere.otf", dueIn(0)}});
  LogCapture log;
  daemon_->setupForScheduledFontDeletion();  // start-up with entries pending: a run at once
  advance(0s);
  EXPECT_EQ(log.count("scheduled deletion: 3"), 1u);
  EXPECT_EQ(table(), Value::dictionary({{kFiles + "a/Later.otf", dueIn(180)}}));
  EXPECT_THAT(fake_.fileSystem.removed(),
              ElementsAre(kFiles + "a/Now.otf", kFiles + "a/Soon.otf", kFiles + "b/Only.otf",
                          kFiles + "b"));  // "a" still holds Later.otf
  EXPECT_EQ(log.count("next deletion after 180 seconds."), 1u);
  EXPECT_EQ(timerDeadline(), std::make_pair(225.0, 45.0));

  advance(225s);
  EXPECT_EQ(log.count("all files deleted."), 1u);
  EXPECT_EQ(timerState(), OneShotTimer::State::None);
  EXPECT_FALSE(fake_.fileSystem.fileExists(kFiles + "a"));
}

TEST_F(ScheduledDeletionTest, ARunKeepsBelowTheFontDirectories) {
  fake_.fileSystem.writeFile(kFiles + "lonely/A.otf", "x");
  fake_.fileSystem.writeFile("/var/mobile/Library/UserFonts/UserFonts.plist", "{}");
  // The second entry was stored before such paths were refused.
  setTable({{kFiles + "lonely", dueIn(0)}, {kFiles + "../UserFonts.plist", dueIn(0)}});
  LogCapture log;
  daemon_->setFontFilesDeletionTimer(0);
  advance(0s);
  // The emptied font-files directory itself stays.
  EXPECT_THAT(fake_.fileSystem.removed(), ElementsAre(kFiles + "lonely"));
  EXPECT_EQ(
      log.count("executeScheduledFontFilesDeletion: dropped 1 entries that are not plain paths"),
      1u);
  EXPECT_EQ(table(), Value(Dictionary()));
}

TEST_F(ScheduledDeletionTest, EntriesFarOffOnlyMoveTheTimer) {
  setTable({{kFiles + "a/A.otf", dueIn(1000.7)}, {kFiles + "a/B.otf", dueIn(5000)}});
  LogCapture log;
  daemon_->setFontFilesDeletionTimer(0);
  advance(0s);
  EXPECT_EQ(log.count("next deletion after 1000 seconds."), 1u);
  EXPECT_EQ(timerDeadline(), std::make_pair(1250.0, 250.0));
  EXPECT_THAT(fake_.fileSystem.removed(), IsEmpty());
}

TEST_F(ScheduledDeletionTest, InstalledAssetsStayAndFailuresAreReported) {
  fake_.fileSystem.writeFile(kAssets + "Serif/Serif.ttf", "x");
  fake_.fileSystem.makeDirectory(kStore + "Serif");
  fake_.fileSystem.writeFile(kFiles + "a/Locked.otf", "x");
  fake_.fileSystem.failRemoval(kFiles + "a/Locked.otf", "Operation not permitted");
  setTable({{kAssets + "Serif/Serif.ttf", dueIn(0)}, {kFiles + "a/Locked.otf", dueIn(0)}});
  LogCapture log;
  daemon_->setFontFilesDeletionTimer(0);
  advance(0s);
  EXPECT_TRUE(fake_.fileSystem.fileExists(kAssets + "Serif/Serif.ttf"));
  EXPECT_EQ(log.count("scheduled deletion failed: \"" + kFiles +
                      "a/Locked.otf\" - Operation not permitted"),
            1u);
  EXPECT_EQ(table(), Value(Dictionary()));  // neither is retried

  // An empty table at the start of a run is reported and stops the timer.
  daemon_->setFontFilesDeletionTimer(0);
  advance(0s);
  EXPECT_EQ(log.count("executeScheduledFontFilesDeletion - no files to delete."), 1u);
  EXPECT_EQ(timerState(), OneShotTimer::State::None);
}

TEST_F(ScheduledDeletionTest, StartUpWithoutPendingEntriesArmsNothingAndClientsScheduleOverIpc) {
  daemon_->setupForScheduledFontDeletion();
  settle();
  EXPECT_EQ(timerState(), OneShotTimer::State::None);

  daemon_->setupForLumoService();
  auto client = fake_.ipc.listener(kServiceName)->connect();
  auto sent = client->deliver(op::kScheduleFontFilesDeletion, {Value::array({kFiles + "a/A.otf"})});
  EXPECT_TRUE(sent.accepted);
  settle();
  EXPECT_TRUE(table().asDictionary()->contains(kFiles + "a/A.otf"));
  client->invalidate();
}

}  // namespace
}  // namespace typhora
