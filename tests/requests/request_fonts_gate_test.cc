// The request gate under many threads arriving while another releases (its order and timing are
// tested through the daemon, on the manual clock).
#include "requests/request_fonts_gate.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "platform/dispatch/semaphore.h"

namespace typhora {
namespace {

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
