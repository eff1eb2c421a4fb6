// Request analytics: the event's four keys and the persistent counters.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "daemon/typhora_daemon.h"
#include "support/fake_platform.h"

namespace typhora {
namespace {

using ::testing::ElementsAre;
using testing::FakePlatform;
using ::testing::Pair;

class RequestAnalyticsTest : public ::testing::Test {
 protected:
  FakePlatform fake_;
  std::shared_ptr<TyphoraDaemon> daemon_ = std::make_shared<TyphoraDaemon>(fake_.platform);
};

TEST_F(RequestAnalyticsTest, EveryRequestSendsOneEventWithItsCounts) {
  daemon_->analyticsEventRequestFonts("com.app", 0, 0, 0);
  daemon_->analyticsEventRequestFonts("com.app", 1, 2, 3);
  EXPECT_THAT(
      fake_.analytics.events(),
      ElementsAre(
          Pair("com.zorvane.font-privacy",
               Value::dictionary(
                   {{"misses", 0}, {"name", "com.app"}, {"resolved", 0}, {"suggestions", 0}})),
          Pair("com.zorvane.font-privacy",
               Value::dictionary(
                   {{"misses", 1}, {"name", "com.app"}, {"resolved", 3}, {"suggestions", 2}}))));
}

TEST_F(RequestAnalyticsTest, CountersGrowUntilExtractedAndWriteOnlyWhenTheyChange) {
  std::uint64_t missed = 9, resolved = 9;
  daemon_->extractRequestFontsMissed(&missed, &resolved);
  EXPECT_EQ(std::make_pair(missed, resolved), std::make_pair(0ul, 0ul));
  daemon_->recordRequestFontsResultWihtMissed(false, false);
  EXPECT_EQ(fake_.preferences.writes(), 0);

  for (int i = 0; i < 3; ++i) daemon_->recordRequestFontsResultWihtMissed(true, false);
  daemon_->extractRequestFontsMissed(&missed, &resolved);
  EXPECT_EQ(std::make_pair(missed, resolved), std::make_pair(3ul, 0ul));
  EXPECT_EQ(fake_.preferences.value("missed"), Value(0));
  EXPECT_EQ(fake_.preferences.value("resolved"), Value(0));

  daemon_->recordRequestFontsResultWihtMissed(true, true);
  daemon_->extractRequestFontsMissed(&missed, &resolved);
  EXPECT_EQ(std::make_pair(missed, resolved), std::make_pair(1ul, 1ul));
}

}  // namespace
}  // namespace typhora
