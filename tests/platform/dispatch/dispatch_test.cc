// Serial queues on the shared pool, the manual clock, one-shot timers and log formatting.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/dispatch/manual_clock.h"
#include "platform/dispatch/one_shot_timer.h"
#include "platform/dispatch/semaphore.h"
#include "platform/dispatch/serial_queue.h"
#include "platform/log/log.h"
#include "support/log_capture.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;

TEST(SerialQueue, RunsJobsOneAtATimeInOrderWhateverThreadSubmits) {
  auto queue = SerialQueue::create("test.order");
  std::vector<int> seen;
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  for (int i = 0; i < 1000; ++i) {
    queue->async([&, i] {
      if (++inside > 1) overlapped = true;
      seen.push_back(i);
      --inside;
    });
  }
  queue->sync([] {});
  ASSERT_EQ(seen.size(), 1000u);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(seen[static_cast<std::size_t>(i)], i);
  EXPECT_FALSE(overlapped);
}

TEST(SerialQueue, BlockedJobsDoNotStarveOtherQueues) {
  // Twenty queues whose jobs each wait until all twenty have started: only a pool that grows
  // while jobs block lets them all start.
  constexpr int kQueues = 20;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  std::atomic<int> started{0};
  Semaphore allStarted;
  Semaphore finished;
  for (int i = 0; i < kQueues; ++i) {
    queues.push_back(SerialQueue::create("test.blocking"));
    queues.back()->async([&] {
      if (++started == kQueues) {
        for (int k = 0; k < kQueues; ++k) allStarted.signal();
      }
      allStarted.wait();
      finished.signal();
    });
  }
  for (int i = 0; i < kQueues; ++i) finished.wait();
  EXPECT_EQ(started.load(), kQueues);
}

TEST(SerialQueue, AQueueThatCallersWaitOnProgressesWhateverThePoolSize) {
  // Two workers, and a thousand callers, each on its own queue, that sync onto one shared queue.
  // The shared queue is busy first and has more jobs than one worker's turn, so it goes back in
  // line behind the callers: every worker ends up blocked in sync() while it waits for a worker.
  SerialQueue::setPoolLimit(2);
  constexpr int kCallers = 1000;
  struct Scene {  // shared with the jobs, which may outlive a failed test
    std::shared_ptr<SerialQueue> shared = SerialQueue::create("test.shared");
    std::vector<std::shared_ptr<SerialQueue>> callers;
    Semaphore open;
    Semaphore allAnswered;
    std::atomic<int> quick{0};
    std::atomic<int> answered{0};
  };
  auto scene = std::make_shared<Scene>();
  scene->shared->async([scene] { scene->open.wait(); });
  for (int i = 0; i < 100; ++i) scene->shared->async([scene] { ++scene->quick; });
  for (int i = 0; i < kCallers; ++i) {
    scene->callers.push_back(SerialQueue::create("test.caller"));
    scene->callers.back()->async([scene] {
      scene->shared->sync([] {});
      if (++scene->answered == kCallers) scene->allAnswered.signal();
    });
  }
  scene->open.signal();
  const bool done = scene->allAnswered.waitFor(60s);
  SerialQueue::setPoolLimit(64);
  ASSERT_TRUE(done) << scene->answered.load() << " of " << kCallers << " callers answered";
  EXPECT_EQ(scene->quick.load(), 100);
}

TEST(SerialQueue, SyncRunsInlineOrWaitsAndKnowsItsQueue) {
  auto a = SerialQueue::create("test.a");
  auto b = SerialQueue::create("test.b");
  EXPECT_EQ(SerialQueue::current(), nullptr);
  bool ran = false;
  a->sync([&] {
    EXPECT_TRUE(a->isCurrent());
    EXPECT_EQ(SerialQueue::current(), a.get());
    b->sync([&] {
      // Through a chain of syncs both queues count as current.
      EXPECT_TRUE(a->isCurrent());
      EXPECT_TRUE(b->isCurrent());
      EXPECT_EQ(SerialQueue::current(), b.get());
      ran = true;
    });
  });
  EXPECT_TRUE(ran);
  EXPECT_FALSE(a->isCurrent());

  // Sync behind queued work waits for that work.
  Semaphore release;
  std::atomic<bool> firstDone{false};
  a->async([&] {
    release.wait();
    firstDone = true;
  });
  std::thread releaser([&] {
    std::this_thread::sleep_for(20ms);
    release.signal();
  });
  a->sync([&] { EXPECT_TRUE(firstDone); });
  releaser.join();
}

// A queue claimed by a thread waits for that thread: the pool leaves it alone, jobs queued
// meanwhile (a sync caller's too) run after the claiming job, on the claimer, as the queue's.
TEST(SerialQueue, AClaimedQueueRunsOnItsClaimerInOrder) {
  auto queue = SerialQueue::create("test.claimed");
  std::vector<std::string> seen;
  std::atomic<int> offClaimer{0};
  const auto here = std::this_thread::get_id();
  auto job = [&](std::string name) {
    return [&, name] {
      if (!queue->isCurrent()) seen.push_back("not current");
      if (name != "sync" && std::this_thread::get_id() != here) ++offClaimer;
      seen.push_back(name);
    };
  };
  ASSERT_TRUE(queue->asyncClaiming(job("a")));
  EXPECT_FALSE(queue->asyncClaiming(job("b")));
  queue->async(job("c"));
  std::thread caller([&] { queue->sync(job("sync")); });
  for (int i = 0; i < 500 && queue->pendingJobs() < 4; ++i) std::this_thread::sleep_for(10ms);
  std::this_thread::sleep_for(50ms);
  EXPECT_EQ(queue->pendingJobs(), 4u) << "nothing of a claimed queue runs before its claimer";
  queue->drainClaimed();
  caller.join();
  EXPECT_EQ(seen, (std::vector<std::string>{"a", "b", "c", "sync"}));
  EXPECT_EQ(offClaimer.load(), 0);
  // Once drained, the queue is the pool's again.
  queue->async(job("d"));
  queue->sync([] {});
  EXPECT_EQ(seen.back(), "d");
}

TEST(SerialQueueDeathTest, SyncOntoTheRunningQueueAbortsNamingIt) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        auto outer = SerialQueue::create("com.example.outer");
        auto inner = SerialQueue::create("com.example.inner");
        outer->sync([&] { inner->sync([&] { outer->sync([] {}); }); });
      },
      "sync onto queue 'com.example.outer' from a job already running on it");
  EXPECT_DEATH(SerialQueue::create("com.example.q")->assertCurrent("handleThing"),
               "handleThing must run on queue 'com.example.q'");
}

TEST(SerialQueue, ManualQueuesRunOnlyWhenDriven) {
  auto main = SerialQueue::createManual("test.main");
  std::vector<int> order;
  main->async([&] { order.push_back(1); });
  main->async([&] {
    order.push_back(2);
    main->async([&] { order.push_back(3); });
  });
  EXPECT_TRUE(order.empty());
  EXPECT_EQ(main->runUntilIdle(), 3u);
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
}

TEST(ManualClock, AlarmsFireInDeadlineOrderAtTheirOwnTimes) {
  ManualClock clock(Date{1000});
  std::vector<std::pair<int, double>> fired;
  clock.schedule(30s, 0s, [&] { fired.emplace_back(30, clock.now().secondsSince1970); });
  clock.schedule(10s, 0s, [&] {
    fired.emplace_back(10, clock.now().secondsSince1970);
    clock.schedule(5s, 0s, [&] { fired.emplace_back(15, clock.now().secondsSince1970); });
  });
  auto cancelled = clock.schedule(20s, 0s, [&] { fired.emplace_back(20, 0); });
  cancelled->cancel();
  clock.advance(29s);
  EXPECT_EQ(fired, (std::vector<std::pair<int, double>>{{10, 1010}, {15, 1015}}));
  clock.advance(1s);
  EXPECT_EQ(fired.back(), (std::pair<int, double>{30, 1030}));
  EXPECT_EQ(clock.pendingAlarms(), 0u);
  EXPECT_EQ(clock.now().secondsSince1970, 1030);
}

class TimerTest : public ::testing::Test {
 protected:
  int runHandlers() { return static_cast<int>(queue->runUntilIdle()); }

  ManualClock clock;
  std::shared_ptr<SerialQueue> queue = SerialQueue::createManual("test.timer", &clock);
  int fired = 0;
  std::shared_ptr<OneShotTimer> timer = OneShotTimer::create(queue, clock, [this] { ++fired; });
};

TEST_F(TimerTest, AThreeHourDelayFiresAtThreeHoursOnTheTargetQueue) {
  EXPECT_EQ(timer->state(), OneShotTimer::State::None);
  timer->schedule(10800s, 2700s);
  EXPECT_EQ(timer->state(), OneShotTimer::State::Pending);
  clock.advance(10799s);
  runHandlers();
  EXPECT_EQ(fired, 0);
  clock.advance(1s);
  EXPECT_EQ(timer->state(), OneShotTimer::State::Fired);
  EXPECT_EQ(fired, 0);  // the handler waits for its queue
  runHandlers();
  EXPECT_EQ(fired, 1);
  clock.advance(100000s);
  runHandlers();
  EXPECT_EQ(fired, 1);  // one-shot
}

TEST_F(TimerTest, ReArmingReplacesAPendingDeadlineAndRevivesAFiredTimer) {
  timer->schedule(100s, 0s);
  timer->schedule(10s, 0s);  // pending: the new deadline replaces the old one
  clock.advance(10s);
  runHandlers();
  EXPECT_EQ(fired, 1);
  clock.advance(90s);
  runHandlers();
  EXPECT_EQ(fired, 1);  // the replaced deadline never fires

  timer->schedule(0s, 60s);  // fired: arming again makes it pending
  EXPECT_EQ(timer->state(), OneShotTimer::State::Pending);
  clock.advance(0s);
  runHandlers();
  EXPECT_EQ(fired, 2);
}

TEST_F(TimerTest, CancelStopsAPendingTimerOnly) {
  timer->schedule(5s, 1s);
  timer->cancel();
  EXPECT_EQ(timer->state(), OneShotTimer::State::None);
  clock.advance(10s);
  runHandlers();
  EXPECT_EQ(fired, 0);
  timer->schedule(5s, 1s);
  clock.advance(5s);
  timer->cancel();  // already fired: nothing changes
  EXPECT_EQ(timer->state(), OneShotTimer::State::Fired);
  runHandlers();
  EXPECT_EQ(fired, 1);
}

TEST(SystemClockTimer, NeverFiresBeforeItsDeadline) {
  auto queue = SerialQueue::create("test.system-timer");
  Semaphore done;
  auto start = std::chrono::steady_clock::now();
  std::chrono::steady_clock::duration firedAfter{};
  auto timer = OneShotTimer::create(queue, Clock::system(), [&] {
    firedAfter = std::chrono::steady_clock::now() - start;
    done.signal();
  });
  timer->schedule(30ms, 10ms);
  done.wait();
  EXPECT_GE(firedAfter, 30ms);
}

// Lines written while a peer's call is handled name that peer; nested scopes restore the outer
// peer, and other threads never see it.
TEST(Log, LinesCarryThePeerOfTheirThread) {
  testing::LogCapture log;
  {
    LogPeerScope outer({41, "com.example.reader"});
    {
      LogPeerScope inner({42, ""});
      TYLog(kTYLogTyphoraDaemon, "inner");
    }
    TYLog(kTYLogTyphoraDaemon, "outer");
    std::thread([] { TYLog(kTYLogTyphoraDaemon, "elsewhere"); }).join();
  }
  TYLog(kTYLogTyphoraDaemon, "none");
  auto lines = log.lines();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_EQ(lines[0].peerPid, 42);
  EXPECT_EQ(lines[0].peerIdentifier, "");
  EXPECT_EQ(lines[1].peerPid, 41);
  EXPECT_EQ(lines[1].peerIdentifier, "com.example.reader");
  EXPECT_EQ(lines[2].peerPid, 0);
  EXPECT_EQ(lines[3].peerPid, 0);
  EXPECT_EQ(currentLogPeer(), nullptr);
}

TEST(Log, FormatsConversionsAndFiltersLevels) {
  EXPECT_EQ(formatLog("error reading %@", {std::string("/var/x")}), "error reading /var/x");
  EXPECT_EQ(formatLog("%s %d %u %ld %zu %%", {"a", -3, 7u, 9L, std::size_t{2}}), "a -3 7 9 2 %");
  EXPECT_EQ(formatLog("%@ and %@", {Value::array({1, "x"})}), "[1,\"x\"] and (missing)");
  EXPECT_EQ(formatLog("%q stays", {}), "%q stays");

  testing::LogCapture log;
  TYLog_Debug(kTYLogTyphoraDaemon, "next deletion after %d seconds.", 90);
  TYLog_Error(kTYLogTyphoraDaemon, "scheduled deletion failed: \"%@\" - %@", "/a", "gone");
  SystemLog("lumo error: %s - %@", "site", Value("boom"));
  auto lines = log.lines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0].message, "next deletion after 90 seconds.");
  EXPECT_EQ(lines[0].level, LogLevel::Debug);
  EXPECT_EQ(lines[1].message, "scheduled deletion failed: \"/a\" - gone");
  EXPECT_EQ(lines[2].category, "system");
  EXPECT_EQ(lines[2].message, "lumo error: site - boom");

  setLogLevel(LogLevel::Error);
  TYLog(kTYLogTyphoraDaemon, "dropped");
  EXPECT_EQ(log.count("dropped"), 0u);
}

TEST(Log, ArgumentsCannotEndTheLineOrForgeAnother) {
  testing::LogCapture log;
  // Newlines, escapes, C1 controls and separators, and a huge double for "%d".
  const std::string text(
      "a\nb\r\x1b[2K\0c\xc2\x85"
      "d\xe2\x80\xa8"
      "e\x7f\xc3\xa9",
      20);
  SystemLog("refused %@ after %d", text, 1e300);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].message,
            "refused a\\nb\\r\\x1b[2K\\x00c\\u0085d\\u2028e\\x7f\xc3\xa9 after "
            "9223372036854775807");
}

}  // namespace
}  // namespace typhora
