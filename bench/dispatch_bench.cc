// Serial queues: how fast jobs go through one queue, what a sync round trip from another thread
// costs, how many queues the pool serves at once, and how late a timer fires.
#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <vector>

#include "platform/dispatch/clock.h"
#include "platform/dispatch/one_shot_timer.h"
#include "platform/dispatch/semaphore.h"
#include "platform/dispatch/serial_queue.h"

namespace typhora {
namespace {

void BM_AsyncThroughputOneQueue(benchmark::State& state) {
  auto queue = SerialQueue::create("bench.async");
  constexpr int kJobs = 10'000;
  for (auto _ : state) {
    Semaphore done;
    int ran = 0;
    for (int i = 0; i < kJobs; ++i) {
      queue->async([&ran, &done] {
        if (++ran == kJobs) done.signal();
      });
    }
    done.wait();
  }
  state.counters["jobs_per_s"] =
      benchmark::Counter(static_cast<double>(kJobs) * static_cast<double>(state.iterations()),
                         benchmark::Counter::kIsRate);
}
BENCHMARK(BM_AsyncThroughputOneQueue)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_SyncRoundTrip(benchmark::State& state) {
  auto queue = SerialQueue::create("bench.sync");
  int value = 0;
  for (auto _ : state) queue->sync([&value] { ++value; });
  benchmark::DoNotOptimize(value);
}
BENCHMARK(BM_SyncRoundTrip)->Unit(benchmark::kMicrosecond);

// Many queues at once, each with a short chain of jobs: the pool's fan-out.
void BM_ManyQueues(benchmark::State& state) {
  const int queues = static_cast<int>(state.range(0));
  std::vector<std::shared_ptr<SerialQueue>> all;
  for (int i = 0; i < queues; ++i) all.push_back(SerialQueue::create("bench.many"));
  for (auto _ : state) {
    Semaphore done;
    std::atomic<int> finished{0};
    for (auto& queue : all) {
      for (int j = 0; j < 100; ++j) {
        queue->async([&, last = j == 99] {
          if (last && ++finished == queues) done.signal();
        });
      }
    }
    done.wait();
  }
  state.counters["jobs_per_s"] = benchmark::Counter(
      100.0 * queues * static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_ManyQueues)->Arg(1)->Arg(16)->Arg(256)->Unit(benchmark::kMillisecond)->UseRealTime();

// How late a one-shot timer of 1 ms fires on the system clock.
void BM_TimerLateness(benchmark::State& state) {
  auto queue = SerialQueue::create("bench.timer");
  double lateMicroseconds = 0;
  for (auto _ : state) {
    Semaphore fired;
    const auto armed = std::chrono::steady_clock::now();
    std::chrono::steady_clock::time_point at;
    auto timer = OneShotTimer::create(queue, Clock::system(), [&] {
      at = std::chrono::steady_clock::now();
      fired.signal();
    });
    timer->schedule(std::chrono::milliseconds(1), Duration::zero());
    fired.wait();
    lateMicroseconds += std::chrono::duration<double, std::micro>(at - armed).count() - 1000.0;
  }
  state.counters["late_us"] = lateMicroseconds / static_cast<double>(state.iterations());
}
BENCHMARK(BM_TimerLateness)->Unit(benchmark::kMillisecond)->Iterations(200);

}  // namespace
}  // namespace typhora

BENCHMARK_MAIN();
