#include "platform/queue.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/semaphore.h"
#include "platform/worker_pool.h"

namespace {

using platform::Queue;
using platform::Semaphore;
using namespace std::chrono_literals;

// Only bounds waits that must succeed, so that a fault fails the test instead of hanging it.
constexpr auto kBound = 30s;
// For checking that something has NOT happened while it must not.
constexpr auto kShort = 20ms;

bool arrives(Semaphore& s) { return s.waitFor(kBound); }

bool arrivesTimes(Semaphore& s, int times) {
  for (int i = 0; i < times; ++i) {
    if (!arrives(s)) return false;
  }
  return true;
}

enum class Kind { serial, concurrent };
constexpr Kind kBothKinds[] = {Kind::serial, Kind::concurrent};

// The only reference to a new queue of that kind.
std::shared_ptr<Queue> make(Kind kind, const std::string& name) {
  return kind == Kind::serial ? Queue::serial(name + ".serial")
                              : Queue::concurrent(name + ".concurrent");
}

TEST(SerialQueue, RunsItemsOneAtATimeInSubmissionOrderAcrossProducers) {
  constexpr int kProducers = 4;
  constexpr int kEach = 2000;
  auto queue = Queue::serial("test.serial.order");
  std::vector<std::pair<int, int>> ran;  // plain on purpose: only the queue's work touches it
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};

  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < kEach; ++i) {
        queue->async([&, p, i] {
          if (inside.fetch_add(1) != 0) overlapped = true;
          ran.emplace_back(p, i);
          inside.fetch_sub(1);
        });
      }
    });
  }
  for (auto& t : producers) t.join();
  queue->sync([] {});

  EXPECT_FALSE(overlapped.load());
  ASSERT_EQ(ran.size(), static_cast<std::size_t>(kProducers * kEach));
  std::array<int, kProducers> next{};
  for (const auto& [p, i] : ran) {
    ASSERT_EQ(i, next[static_cast<std::size_t>(p)]) << "producer " << p;
    ++next[static_cast<std::size_t>(p)];
  }
}

TEST(SerialQueue, WorkSubmittedFromItsOwnWorkKeepsItsPlace) {
  // B is submitted by A; C is submitted by another thread after that, while A is still running.
  auto queue = Queue::serial("test.serial.self-submit");
  std::vector<char> ran;
  Semaphore bSubmitted;
  Semaphore cSubmitted;
  queue->async([&] {
    ran.push_back('A');
    queue->async([&] { ran.push_back('B'); });
    bSubmitted.signal();
    EXPECT_TRUE(arrives(cSubmitted));
  });
  ASSERT_TRUE(arrives(bSubmitted));
  queue->async([&] { ran.push_back('C'); });
  cSubmitted.signal();
  queue->sync([] {});
  EXPECT_EQ(std::string(ran.begin(), ran.end()), "ABC");
}

TEST(Queue, SyncReturnsAfterTheWorkRanAndSeesItsEffects) {
  for (Kind kind : kBothKinds) {
    auto queue = make(kind, "test.sync");
    SCOPED_TRACE(queue->label());
    int value = 0;  // plain on purpose: sync must order the work before the caller's next read
    queue->sync([&] { value = 42; });
    EXPECT_EQ(value, 42);
    queue->barrierSync([&] { value += 1; });
    EXPECT_EQ(value, 43);
  }

  // On a serial queue, and behind a barrier, everything submitted earlier has run too.
  auto serial = Queue::serial("test.sync.after-async");
  int count = 0;
  for (int i = 0; i < 100; ++i) serial->async([&] { ++count; });
  int seen = -1;
  serial->sync([&] { seen = count; });
  EXPECT_EQ(seen, 100);

  auto concurrent = Queue::concurrent("test.sync.after-async.concurrent");
  std::atomic<int> done{0};
  for (int i = 0; i < 100; ++i) concurrent->async([&] { done.fetch_add(1); });
  concurrent->barrierSync([] {});
  EXPECT_EQ(done.load(), 100);

  // sync onto one queue from another queue's work is fine.
  auto caller = Queue::serial("test.sync.caller");
  int fromOther = 0;
  caller->sync([&] { serial->sync([&] { fromOther = 7; }); });
  EXPECT_EQ(fromOther, 7);
}

TEST(ConcurrentQueue, RunsUpToWidthItemsAtOnce) {
  // Two items that each wait for the other can only both finish if they run at the same time.
  auto pair = Queue::concurrent("test.concurrent.pair", 2);
  Semaphore a;
  Semaphore b;
  std::atomic<int> bothSawEachOther{0};
  pair->async([&] {
    a.signal();
    if (arrives(b)) bothSawEachOther.fetch_add(1);
  });
  pair->async([&] {
    b.signal();
    if (arrives(a)) bothSawEachOther.fetch_add(1);
  });
  pair->barrierSync([] {});
  EXPECT_EQ(bothSawEachOther.load(), 2);

  // Exactly `width` items run at once: the next one waits for a free thread.
  constexpr int kWidth = 4;
  auto queue = Queue::concurrent("test.concurrent.width", kWidth);
  Semaphore arrived;
  Semaphore go;
  for (int i = 0; i < kWidth + 1; ++i) {
    queue->async([&] {
      arrived.signal();
      EXPECT_TRUE(arrives(go));
    });
  }
  EXPECT_TRUE(arrivesTimes(arrived, kWidth));
  EXPECT_FALSE(arrived.waitFor(kShort));
  go.signal();
  EXPECT_TRUE(arrives(arrived));
  for (int i = 0; i < kWidth; ++i) go.signal();
  queue->barrierSync([] {});
}

TEST(ConcurrentQueue, BarrierWaitsForEarlierItemsAndHoldsBackLaterOnes) {
  auto queue = Queue::concurrent("test.concurrent.barrier", 4);
  Semaphore beforeStarted;
  Semaphore releaseBefore;
  Semaphore barrierStarted;
  Semaphore releaseBarrier;
  Semaphore afterStarted;
  std::atomic<int> beforeDone{0};
  std::atomic<bool> barrierDone{false};
  int beforeDoneSeenByBarrier = -1;
  bool afterSawBarrierDone = false;

  for (int i = 0; i < 2; ++i) {
    queue->async([&] {
      beforeStarted.signal();
      EXPECT_TRUE(arrives(releaseBefore));
      beforeDone.fetch_add(1);
    });
  }
  ASSERT_TRUE(arrivesTimes(beforeStarted, 2));
  queue->barrierAsync([&] {
    beforeDoneSeenByBarrier = beforeDone.load();
    barrierStarted.signal();
    EXPECT_TRUE(arrives(releaseBarrier));
    barrierDone = true;
  });
  queue->async([&] {
    afterSawBarrierDone = barrierDone.load();
    afterStarted.signal();
  });

  // Two threads are free, yet neither the barrier nor the item after it may start.
  EXPECT_FALSE(barrierStarted.waitFor(kShort));
  EXPECT_FALSE(afterStarted.waitFor(kShort));
  releaseBefore.signal();
  releaseBefore.signal();
  ASSERT_TRUE(arrives(barrierStarted));
  EXPECT_FALSE(afterStarted.waitFor(kShort));
  releaseBarrier.signal();
  ASSERT_TRUE(arrives(afterStarted));
  queue->barrierSync([] {});

  EXPECT_EQ(beforeDoneSeenByBarrier, 2);
  EXPECT_TRUE(afterSawBarrierDone);
}

TEST(ConcurrentQueue, BarriersSplitAStreamOfItemsIntoRounds) {
  constexpr int kRounds = 50;
  constexpr int kItems = 20;
  auto queue = Queue::concurrent("test.concurrent.rounds", 4);
  std::atomic<int> active{0};
  std::atomic<int> barriersDone{0};
  std::array<std::atomic<int>, kRounds> itemsDone{};
  std::atomic<int> faults{0};

  for (int round = 0; round < kRounds; ++round) {
    for (int i = 0; i < kItems; ++i) {
      queue->async([&, round] {
        active.fetch_add(1);
        if (barriersDone.load() != round) faults.fetch_add(1);
        std::this_thread::yield();  // widens the window in which a misplaced item would overlap
        itemsDone[static_cast<std::size_t>(round)].fetch_add(1);
        if (barriersDone.load() != round) faults.fetch_add(1);
        active.fetch_sub(1);
      });
    }
    queue->barrierAsync([&, round] {
      if (active.load() != 0) faults.fetch_add(1);
      if (itemsDone[static_cast<std::size_t>(round)].load() != kItems) faults.fetch_add(1);
      std::this_thread::yield();
      if (active.load() != 0) faults.fetch_add(1);
      barriersDone.fetch_add(1);
    });
  }
  queue->barrierSync([] {});
  EXPECT_EQ(faults.load(), 0);
  EXPECT_EQ(barriersDone.load(), kRounds);
}

TEST(Queue, CurrentIsTheQueueRunningTheCallersWork) {
  auto serial = Queue::serial("test.current.serial");
  auto concurrent = Queue::concurrent("test.current.concurrent");
  EXPECT_EQ(Queue::current(), nullptr);
  EXPECT_FALSE(serial->isCurrent());

  const Queue* inSerial = nullptr;
  bool serialIsCurrent = false;
  bool concurrentIsCurrentInSerial = true;
  const Queue* nested = nullptr;
  const Queue* afterNested = nullptr;
  serial->sync([&] {
    inSerial = Queue::current();
    serialIsCurrent = serial->isCurrent();
    concurrentIsCurrentInSerial = concurrent->isCurrent();
    concurrent->sync([&] { nested = Queue::current(); });
    afterNested = Queue::current();
  });
  EXPECT_EQ(inSerial, serial.get());
  EXPECT_TRUE(serialIsCurrent);
  EXPECT_FALSE(concurrentIsCurrentInSerial);
  EXPECT_EQ(nested, concurrent.get());
  EXPECT_EQ(afterNested, serial.get());

  std::atomic<const Queue*> inAsync{nullptr};
  std::atomic<const Queue*> inBarrier{nullptr};
  concurrent->async([&] { inAsync = Queue::current(); });
  concurrent->barrierSync([&] { inBarrier = Queue::current(); });
  EXPECT_EQ(inAsync.load(), concurrent.get());
  EXPECT_EQ(inBarrier.load(), concurrent.get());
  EXPECT_EQ(Queue::current(), nullptr);
}

TEST(Queue, DroppingTheLastReferenceRunsEverythingAlreadySubmitted) {
  constexpr int kItems = 200;
  for (Kind kind : kBothKinds) {
    auto queue = make(kind, "test.drain");
    SCOPED_TRACE(queue->label());
    Queue* raw = queue.get();
    Semaphore gate;
    Semaphore dropping;
    std::atomic<int> ran{0};
    queue->async([&] { EXPECT_TRUE(arrives(gate)); });
    for (int i = 0; i < kItems; ++i) {
      if (i == kItems / 2) queue->barrierAsync([&] { ran.fetch_add(1); });
      queue->async([&] { ran.fetch_add(1); });
    }
    // Work that the draining work submits runs as well.
    queue->async([&, raw] { raw->async([&] { ran.fetch_add(1); }); });

    ASSERT_EQ(queue.use_count(), 1);
    std::thread dropper([&dropping, queue = std::move(queue)]() mutable {
      dropping.signal();
      queue.reset();
    });
    ASSERT_TRUE(arrives(dropping));
    gate.signal();
    dropper.join();
    EXPECT_EQ(ran.load(), kItems + 2);
  }
}

TEST(Queue, LastReferenceDroppedByItsOwnWork) {
  for (bool inBody : {true, false}) {
    for (Kind kind : kBothKinds) {
      auto queue = make(kind, inBody ? "test.self-drop.body" : "test.self-drop.capture");
      SCOPED_TRACE(queue->label());
      const Queue* raw = queue.get();
      Semaphore gate;
      Semaphore laterRan;
      std::atomic<const Queue*> laterSaw{nullptr};
      if (inBody) {
        queue->async([self = queue, &gate]() mutable {
          EXPECT_TRUE(arrives(gate));
          self.reset();
        });
      } else {
        // Released with the item's captures once it has run.
        queue->async([self = queue, &gate] { EXPECT_TRUE(arrives(gate)); });
      }
      queue->barrierAsync([&] {
        laterSaw = Queue::current();
        laterRan.signal();
      });
      ASSERT_EQ(queue.use_count(), 2);
      queue.reset();
      gate.signal();
      // The queue winds down on its own: the later item still runs, on the same queue.
      ASSERT_TRUE(arrives(laterRan));
      EXPECT_EQ(laterSaw.load(), raw);
    }
  }
}

TEST(SerialQueue, BlockedQueuesTakeAtMostThePoolsBoundAndAllComplete) {
  constexpr int kQueues = 100;
  constexpr unsigned kBound = 8;
  platform::WorkerPool pool("test.bounded", {.minimum = 1, .maximum = kBound});
  std::vector<std::shared_ptr<Queue>> queues;
  Semaphore started, release, finished;
  for (int i = 0; i < kQueues; ++i) {
    queues.push_back(Queue::serial("test.blocked." + std::to_string(i), &pool));
    queues.back()->async([&] {
      started.signal();
      EXPECT_TRUE(arrives(release));
      finished.signal();
    });
  }
  // The pool grows while its workers block, up to its bound; the other queues wait their turn...
  ASSERT_TRUE(arrivesTimes(started, kBound));
  EXPECT_FALSE(started.waitFor(kShort));
  EXPECT_EQ(pool.threads(), kBound);
  // ...and queues on another pool are not held up meanwhile.
  Semaphore otherRan;
  Queue::serial("test.blocked.other")->async([&] { otherRan.signal(); });
  EXPECT_TRUE(arrives(otherRan));

  for (int i = 0; i < kQueues; ++i) release.signal();
  EXPECT_TRUE(arrivesTimes(finished, kQueues));
}

TEST(SerialQueue, SyncOnAnIdleQueueRunsOnTheCallingThreadAsTheQueue) {
  auto queue = Queue::serial("test.inline");
  std::thread::id ranOn;
  const Queue* current = nullptr;
  queue->sync([&] {
    ranOn = std::this_thread::get_id();
    current = Queue::current();
  });
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_EQ(current, queue.get());
}

TEST(Queue, RejectsEmptyWorkAndZeroWidth) {
  for (Kind kind : kBothKinds) {
    auto queue = make(kind, "test.reject");
    EXPECT_THROW(queue->async({}), std::invalid_argument);
    EXPECT_THROW(queue->sync({}), std::invalid_argument);
    EXPECT_THROW(queue->barrierAsync({}), std::invalid_argument);
    EXPECT_THROW(queue->barrierSync({}), std::invalid_argument);
  }
  EXPECT_THROW(Queue::concurrent("test.reject.width", 0), std::invalid_argument);
}

class QueueDeathTest : public ::testing::Test {
 protected:
  // The child re-runs the test binary instead of forking a process that has queue threads.
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(QueueDeathTest, WaitingOnTheQueueThatRunsTheCallerAborts) {
  EXPECT_DEATH(
      {
        auto queue = Queue::serial("test.death.serial");
        queue->sync([&] { queue->sync([] {}); });
      },
      "test\\.death\\.serial.*sync");
  EXPECT_DEATH(
      {
        auto queue = Queue::concurrent("test.death.barrier");
        queue->async([&] { queue->barrierSync([] {}); });
        queue->barrierSync([] {});
      },
      "test\\.death\\.barrier.*barrierSync");
  EXPECT_DEATH(
      {
        auto queue = Queue::concurrent("test.death.concurrent");
        queue->sync([&] { queue->sync([] {}); });
      },
      "test\\.death\\.concurrent.*sync");
}

TEST_F(QueueDeathTest, ExceptionEscapingAWorkItemIsReportedAndTerminates) {
  EXPECT_DEATH(
      {
        auto queue = Queue::serial("test.death.throw");
        queue->sync([] { throw std::runtime_error("item failed"); });
      },
      "test\\.death\\.throw.*item failed");
}

}  // namespace
