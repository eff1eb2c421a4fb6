// The request gate on its own: arrival counts, admission in arrival order, and many threads
// arriving while others release.
#include "requests/request_fonts_gate.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "platform/semaphore.h"

namespace typhora {
namespace {

TEST(RequestFontsGateTest, AdmitsOneAtATimeInArrivalOrder) {
  RequestFontsGate gate;
  std::vector<int> admitted;
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(gate.arrive(), static_cast<std::uint64_t>(i));
    gate.acquire([&admitted, i] { admitted.push_back(i); });
  }
  EXPECT_THAT(admitted, ::testing::ElementsAre(0));
  gate.release();
  EXPECT_THAT(admitted, ::testing::ElementsAre(0, 1));
  EXPECT_EQ(gate.waiting(), 2u);
  gate.release();
  gate.release();
  EXPECT_THAT(admitted, ::testing::ElementsAre(0, 1, 2));
  EXPECT_EQ(gate.waiting(), 0u);
  // Free again: the next arrival passes at once.
  gate.arrive();
  gate.acquire([&admitted] { admitted.push_back(3); });
  EXPECT_EQ(admitted.back(), 3);
}

TEST(RequestFontsGateTest, EveryArrivalFromManyThreadsIsAdmittedExactlyOnce) {
  RequestFontsGate gate;
  constexpr int kThreads = 8;
  constexpr int kEach = 200;
  std::atomic<int> admitted{0};
  std::atomic<int> holders{0};
  Semaphore permits;  // one signal per admission: the releasing thread's work
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < kEach; ++i) {
        gate.arrive();
        gate.acquire([&] {
          EXPECT_EQ(holders.fetch_add(1), 0);  // never two holders at once
          ++admitted;
          permits.signal();
        });
      }
    });
  }
  std::thread releaser([&] {
    for (int i = 0; i < kThreads * kEach; ++i) {
      permits.wait();
      holders.fetch_sub(1);
      gate.release();
    }
  });
  for (auto& thread : threads) thread.join();
  releaser.join();
  EXPECT_EQ(admitted.load(), kThreads * kEach);
  EXPECT_EQ(gate.waiting(), 0u);
}

}  // namespace
}  // namespace typhora
