// Queues, the worker pool under them and the semaphore their work waits on.
#include "platform/dispatch/queue.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <limits>
#include <ranges>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/dispatch/semaphore.h"
#include "platform/dispatch/worker_pool.h"

namespace {

using platform::Queue;
using platform::Semaphore;
using namespace std::chrono_literals;

// Bounds only waits that must succeed, so that a fault fails the test instead of hanging it.
bool arrives(Semaphore& s, int times = 1) {
  return std::ranges::all_of(std::views::iota(0, times), [&](int) { return s.waitFor(30s); });
}
// For checking that something has NOT happened while it must not.
bool staysAway(Semaphore& s) { return !s.waitFor(20ms); }

std::shared_ptr<Queue> make(bool serial, const std::string& name) {
  return serial ? Queue::serial(name + ".serial") : Queue::concurrent(name + ".concurrent");
}

TEST(SerialQueue, RunsItemsOneAtATimeInSubmissionOrderAcrossProducers) {
  auto queue = Queue::serial("test.serial.order");
  std::vector<int> ran[2];  // plain on purpose: only the queue's work touches them
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  auto produce = [&](int p) {
    for (int i = 0; i < 2000; ++i)
      queue->async(
          [&, p, i] { overlapped = overlapped || inside.fetch_add(1) != 0, ran[p].push_back(i), inside.fetch_sub(1); });
  };
  std::thread other(produce, 1);
  produce(0);
  other.join();
  queue->sync([] {});  // returns once everything submitted before it has run
  EXPECT_FALSE(overlapped.load());
  for (const auto& r : ran) {
    ASSERT_EQ(r.size(), 2000u);
    for (int i = 0; i < 2000; ++i) ASSERT_EQ(r[size_t(i)], i);
  }
}

TEST(SerialQueue, WorkSubmittedFromItsOwnWorkKeepsItsPlace) {
  // A submits B; another thread submits C while A still runs: C must not overtake B.
  auto queue = Queue::serial("test.serial.self-submit");
  std::string ran;
  Semaphore bSubmitted, cSubmitted;
  queue->async([&] {
    queue->async([&] { ran += 'B'; });
    bSubmitted.signal();
    EXPECT_TRUE(arrives(cSubmitted));
  });
  ASSERT_TRUE(arrives(bSubmitted));
  queue->async([&] { ran += 'C'; });
  cSubmitted.signal();
  queue->sync([] {});
  EXPECT_EQ(ran, "BC");
}

TEST(ConcurrentQueue, RunsWidthItemsAtOnceAndABarrierAloneBetweenWhatCameBeforeAndAfter) {
  auto queue = Queue::concurrent("test.concurrent", 3);
  Semaphore held, started, release, barrierStarted, releaseBarrier, afterStarted;
  queue->async([&] { EXPECT_TRUE(arrives(held)); });
  queue->sync([] {});  // a plain sync does not wait for work already running
  held.signal();
  std::atomic<int> done{0};
  for (int i = 0; i < 4; ++i)
    queue->async([&] {
      started.signal();
      EXPECT_TRUE(arrives(release));
      done.fetch_add(1);
    });
  EXPECT_TRUE(arrives(started, 3));
  EXPECT_TRUE(staysAway(started));  // the fourth waits for a free thread
  queue->barrierAsync([&] {
    EXPECT_EQ(done.load(), 4);
    barrierStarted.signal();
    EXPECT_TRUE(arrives(releaseBarrier));
    done.fetch_add(1);
  });
  queue->async([&] {
    EXPECT_EQ(done.load(), 5);
    afterStarted.signal();
  });
  release.signal();
  EXPECT_TRUE(arrives(started));  // the fourth takes the freed thread
  release.signal();               // this one stays free
  EXPECT_TRUE(staysAway(barrierStarted));
  EXPECT_TRUE(staysAway(afterStarted));
  release.signal();
  release.signal();
  ASSERT_TRUE(arrives(barrierStarted));
  EXPECT_TRUE(staysAway(afterStarted));  // threads are free, but the barrier runs alone
  releaseBarrier.signal();
  EXPECT_TRUE(arrives(afterStarted));
  queue->barrierSync([] {});
}

TEST(Queue, CurrentIsTheQueueRunningTheCallersWorkAndSyncOnAnIdleSerialQueueRunsInline) {
  auto serial = Queue::serial("test.current.serial");
  auto concurrent = Queue::concurrent("test.current.concurrent");
  EXPECT_EQ(Queue::current(), nullptr);
  const auto caller = std::this_thread::get_id();
  serial->sync([&] {
    EXPECT_EQ(std::this_thread::get_id(), caller);
    EXPECT_TRUE(serial->isCurrent());
    EXPECT_FALSE(concurrent->isCurrent());
    concurrent->sync([&] { EXPECT_EQ(Queue::current(), concurrent.get()); });  // sync onto another queue is fine
    EXPECT_EQ(Queue::current(), serial.get());
  });
  concurrent->async([&] { EXPECT_EQ(Queue::current(), concurrent.get()); });
  concurrent->barrierSync([&] { EXPECT_EQ(Queue::current(), concurrent.get()); });
  EXPECT_FALSE(serial->isCurrent());
}

TEST(Queue, DroppingTheLastReferenceStillRunsEverythingSubmitted) {
  // Dropped by another thread, the drop waits for the work; dropped with the captures of the
  // queue's own work, the queue winds down in the background.
  for (bool fromOwnWork : {false, true}) {
    for (bool serial : {true, false}) {
      auto queue = make(serial, "test.drop");
      Queue* raw = queue.get();
      Semaphore gate, all, dropping;
      std::atomic<int> count{0};
      auto item = [&] { count.fetch_add(1) == 100 ? all.signal() : void(); };
      queue->async([&gate, self = fromOwnWork ? queue : nullptr] { EXPECT_TRUE(arrives(gate)); });
      for (int i = 0; i < 100; ++i) i == 50 ? queue->barrierAsync(item) : queue->async(item);
      queue->async([&, raw] {
        raw->async([&, raw] {
          EXPECT_EQ(Queue::current(), raw);
          item();
        });
      });  // while draining
      std::thread dropper([&dropping, last = std::move(queue)]() mutable { dropping.signal(), last.reset(); });
      ASSERT_TRUE(arrives(dropping));
      gate.signal();
      dropper.join();
      EXPECT_TRUE(fromOwnWork || count.load() == 101);
      EXPECT_TRUE(arrives(all)) << fromOwnWork << serial;
    }
  }
}

TEST(WorkerPool, GrowsOnlyWhileWorkBlocksUpToItsBoundShrinksBackWhenIdleAndRunsEverythingPostedBeforeItGoes) {
  constexpr unsigned kBound = 8;
  std::vector<int> ran;  // plain on purpose: one worker runs the work that never blocks, in order
  std::atomic<int> late{0};
  {
    Semaphore started, release, finished;  // outlive the pool, whose end waits for the work
    platform::WorkerPool pool("test.pool", {.minimum = 1, .maximum = kBound, .idleTimeout = 50ms});
    for (int i = 0; i < 100; ++i) pool.post([&, i] { ran.push_back(i); });
    EXPECT_EQ(pool.threads(), 1u);
    std::vector<std::shared_ptr<Queue>> queues;
    for (int i = 0; i < 20; ++i) {
      queues.push_back(Queue::serial("test.blocked." + std::to_string(i), &pool));
      queues.back()->async([&] {
        started.signal();
        EXPECT_TRUE(arrives(release));
        finished.signal();
      });
    }
    // Blocked workers make room for more, up to the bound; the other queues wait their turn...
    ASSERT_TRUE(arrives(started, kBound));
    EXPECT_TRUE(staysAway(started));
    EXPECT_EQ(pool.threads(), kBound);
    Semaphore otherRan;  // ...and a queue on another pool is not held up meanwhile
    Queue::serial("test.blocked.other")->async([&] { otherRan.signal(); });
    EXPECT_TRUE(arrives(otherRan));
    for (int i = 0; i < 20; ++i) release.signal();
    EXPECT_TRUE(arrives(finished, 20));
    queues.clear();
    for (int i = 0; i < 1000 && pool.threads() > 1; ++i) std::this_thread::sleep_for(10ms);
    EXPECT_EQ(pool.threads(), 1u);  // workers above the minimum end once idle
    for (int i = 0; i < 50; ++i) pool.post([&] { std::this_thread::sleep_for(1ms), late.fetch_add(1); });
  }
  EXPECT_EQ(late.load(), 50);
  ASSERT_EQ(ran.size(), 100u);
  for (int i = 0; i < 100; ++i) EXPECT_EQ(ran[size_t(i)], i);
  Semaphore woken;  // a job wakes an idle worker: this one would otherwise idle for an hour
  platform::WorkerPool sleepy("test.sleepy", {.minimum = 1, .maximum = 1, .idleTimeout = 1h});
  for (int i = 0; i < 20; ++i) {
    sleepy.post([&] { woken.signal(); });
    ASSERT_TRUE(arrives(woken));
  }
}

TEST(WorkerPool, AWorkerBlockedOnWorkOfItsOwnPoolRunsThatWorkWhenNoThreadCanBeStarted) {
  // Without help, the only worker would wait out the 30 s guards below, and the test would fail.
  platform::WorkerPool pool("test.help", {.minimum = 1, .maximum = 8, .helpWhileBlocked = true});
  pool.refuseThreadStarts(true);
  auto waiter = Queue::serial("test.help.waiter", &pool);
  auto serial = Queue::serial("test.help.serial", &pool);
  auto concurrent = Queue::concurrent("test.help.concurrent", 2, &pool);
  std::string ran;  // plain on purpose: the one worker runs everything
  Semaphore done;
  waiter->async([&] {
    Semaphore signed_, verified;
    serial->async([&] { ran += 'a'; });
    serial->async([&] { ran += 'b', signed_.signal(); });
    EXPECT_TRUE(arrives(signed_));
    concurrent->async([&] { ran += 'c'; });
    concurrent->barrierAsync([&] { ran += 'd', verified.signal(); });
    concurrent->async([&] { ran += 'e'; });
    EXPECT_TRUE(arrives(verified));
    serial->sync([&] { ran += 'f'; });
    done.signal();
  });
  ASSERT_TRUE(arrives(done));
  concurrent->barrierSync([] {});
  EXPECT_EQ(ran, "abcdfe");  // each queue's order and the barrier kept; 'e' waits its turn in the pool
  EXPECT_EQ(pool.threads(), 1u);
  EXPECT_GT(pool.threadStartFailures(), 0u);
}

TEST(QueueDeathTest, MisuseAThrowingItemOrASelfDestroyingPoolEndsTheProcess) {
  // The child re-runs the test binary instead of forking a process that has queue threads.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(Queue::serial("test.empty.s")->async({}), "empty\\.s.*empty work");
  EXPECT_DEATH(Queue::concurrent("test.empty.c")->barrierSync({}), "empty\\.c.*empty work");
  EXPECT_DEATH(Queue::concurrent("test.width", 0), "test\\.width.*width 0");
  EXPECT_DEATH(Semaphore(-1), "negative count");
  EXPECT_DEATH(
      {
        auto q = Queue::serial("test.death.s");
        q->sync([&] { q->sync([] {}); });
      },
      "death\\.s.*sync");
  EXPECT_DEATH(
      {
        auto q = Queue::concurrent("test.death.c");
        q->sync([&] { q->sync([] {}); });
      },
      "death\\.c.*sync");
  EXPECT_DEATH(
      {
        auto q = Queue::concurrent("test.death.b");
        q->async([&] { q->barrierSync([] {}); });
        q->barrierSync([] {});
      },
      "death\\.b.*barrierSync");
  EXPECT_DEATH(
      {
        auto* pool = new platform::WorkerPool("test.death.pool", {});
        pool->post([pool] { delete pool; });
        sleep(30);
      },
      "test\\.death\\.pool.*destroyed by its own worker");
  EXPECT_DEATH(Queue::serial("test.death.throw")->sync([] { throw std::runtime_error("item failed"); }),
               "test\\.death\\.throw.*item failed");
}

TEST(Semaphore, TimedWaitsGiveUpAtTheDeadlineTakingNothing) {
  using Clock = std::chrono::steady_clock;
  auto poll = [](Semaphore& s) { return s.waitFor(0ns); };
  Semaphore s(1);
  EXPECT_TRUE(s.waitUntil(Clock::now()));  // the initial count passes at once
  EXPECT_FALSE(s.waitFor(20ms));
  EXPECT_FALSE(s.waitUntil(Clock::now() - 1s));
  s.signal();  // one signal after those time-outs: neither lost nor owed to them
  EXPECT_TRUE(poll(s));
  EXPECT_FALSE(poll(s));
  s.signal();  // a timeout past the clock's range is a plain wait, not a deadline in the past
  EXPECT_TRUE(s.waitFor(std::chrono::nanoseconds::max()));
  Semaphore full(std::numeric_limits<long>::max());
  full.signal();  // saturates instead of overflowing (the sanitizer build traps overflow)
  EXPECT_TRUE(poll(full));
}

TEST(Semaphore, CanBeDestroyedAsSoonAsTheWaitReturns) {
  // The signaller may still be inside signal() when the waiter wakes; it must not touch the object
  // after letting the waiter go (the address sanitizer build catches that).
  for (int i = 0; i < 200; ++i) {
    auto gone = std::make_unique<Semaphore>();
    std::jthread signaller([raw = gone.get()] { raw->signal(); });
    ASSERT_TRUE(gone->waitFor(30s));
    gone.reset();
  }
}

}  // namespace
