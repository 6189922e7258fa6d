// Cost of handing work to a queue and of waking a waiting thread.

#include <benchmark/benchmark.h>

#include <atomic>
#include <thread>

#include "platform/dispatch/queue.h"
#include "platform/dispatch/semaphore.h"

namespace {

using platform::Queue;
using platform::Semaphore;

// One async followed by a sync that waits for it: two items and one wake-up of the caller.
void BM_SerialAsyncSyncRoundTrip(benchmark::State& state) {
  auto queue = Queue::serial("bench.roundtrip");
  long counter = 0;
  for (auto _ : state) {
    queue->async([&counter] { ++counter; });
    queue->sync([&counter] { benchmark::DoNotOptimize(counter); });
  }
  state.SetItemsProcessed(state.iterations() * 2);
}
BENCHMARK(BM_SerialAsyncSyncRoundTrip)->UseRealTime();

// A burst of async items, then one sync: the per-item cost without a wake-up each time.
void BM_SerialAsyncBurst(benchmark::State& state) {
  const auto burst = state.range(0);
  auto queue = Queue::serial("bench.burst");
  long counter = 0;
  for (auto _ : state) {
    for (long i = 0; i < burst; ++i) queue->async([&counter] { ++counter; });
    queue->sync([] {});
  }
  state.SetItemsProcessed(state.iterations() * burst);
}
BENCHMARK(BM_SerialAsyncBurst)->Arg(1000)->UseRealTime();

void BM_ConcurrentAsyncBurst(benchmark::State& state) {
  const auto burst = state.range(0);
  auto queue = Queue::concurrent("bench.concurrent", 4);
  std::atomic<long> counter{0};
  for (auto _ : state) {
    for (long i = 0; i < burst; ++i) queue->async([&counter] { counter.fetch_add(1); });
    queue->barrierSync([] {});
  }
  state.SetItemsProcessed(state.iterations() * burst);
}
BENCHMARK(BM_ConcurrentAsyncBurst)->Arg(1000)->UseRealTime();

// One signal to another thread and one back: two hand-offs.
void BM_SemaphoreHandoff(benchmark::State& state) {
  Semaphore ping;
  Semaphore pong;
  std::atomic<bool> stop{false};
  std::thread other([&] {
    for (;;) {
      ping.wait();
      if (stop.load()) return;
      pong.signal();
    }
  });
  for (auto _ : state) {
    ping.signal();
    pong.wait();
  }
  stop = true;
  ping.signal();
  other.join();
  state.SetItemsProcessed(state.iterations() * 2);
}
BENCHMARK(BM_SemaphoreHandoff)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
