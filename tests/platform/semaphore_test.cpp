#include "platform/semaphore.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <limits>
#include <memory>
#include <stdexcept>
#include <thread>
#include <vector>

namespace {

using platform::Semaphore;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

bool poll(Semaphore& s) { return s.waitFor(0ns); }

TEST(Semaphore, TimedWaitsGiveUpAtTheDeadlineTakingNothing) {
  Semaphore s(1);
  EXPECT_TRUE(s.waitUntil(Clock::now()));  // the initial count passes at once
  EXPECT_FALSE(s.waitFor(20ms));
  EXPECT_FALSE(s.waitUntil(Clock::now() + 20ms));
  EXPECT_FALSE(s.waitUntil(Clock::now() - 1s));
  EXPECT_FALSE(s.waitFor(-1s));
  s.signal();  // one signal after those time-outs: neither lost nor owed to them
  EXPECT_TRUE(poll(s));
  EXPECT_FALSE(poll(s));
  s.signal();  // a timeout past the clock's range is a plain wait, not a deadline in the past
  EXPECT_TRUE(s.waitFor(std::chrono::nanoseconds::max()));
  Semaphore full(std::numeric_limits<long>::max());
  full.signal();  // saturates instead of overflowing (the sanitizer build traps overflow)
  EXPECT_TRUE(poll(full));
  EXPECT_THROW(Semaphore(-1), std::invalid_argument);
}

TEST(Semaphore, WakesBlockedWaitersOnePerSignal) {
  constexpr int kWaiters = 8;
  Semaphore s;
  std::atomic<int> woken{0};
  std::vector<std::thread> waiters;
  for (int i = 0; i < kWaiters; ++i)
    waiters.emplace_back([&] {
      if (s.waitFor(30s)) woken.fetch_add(1);
    });
  for (int i = 0; i < kWaiters; ++i) s.signal();
  for (auto& t : waiters) t.join();
  EXPECT_EQ(woken.load(), kWaiters);
  EXPECT_FALSE(poll(s));
}

TEST(Semaphore, CanBeDestroyedAsSoonAsTheWaitReturns) {
  // The signaller may still be inside signal() when the waiter wakes; it must not touch the object
  // after letting the waiter go (the address sanitizer build catches that).
  for (int i = 0; i < 200; ++i) {
    auto s = std::make_unique<Semaphore>();
    std::thread signaller([raw = s.get()] { raw->signal(); });
    ASSERT_TRUE(s->waitFor(30s));
    s.reset();
    signaller.join();
  }
}

}  // namespace
