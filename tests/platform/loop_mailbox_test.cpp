// The loop mailbox: what becomes of work that its loop does not run. Work that the loop does run is
// what every listener and client test goes through.
#include "platform/bus/loop_mailbox.h"

#include <gtest/gtest.h>

#include <numeric>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "common/log_capture.h"

namespace {

platform::EventPtr newEvent() {
  sd_event* event = nullptr;
  sd_event_new(&event);
  return platform::EventPtr(event);
}

}  // namespace

TEST(LoopMailbox, CloseEndsTheLoopOnceWhatWasPostedHasRunAndDrainRunsWhatNoLoopReached) {
  zlkatest::LogCapture log;
  platform::LoopMailbox unattached;
  EXPECT_FALSE(unattached.post([] {}));  // no loop would ever run it
  platform::EventPtr event = newEvent();
  ASSERT_TRUE(event);
  platform::LoopMailbox mailbox, unread;
  ASSERT_EQ(mailbox.attach(event.get()), 0);
  ASSERT_EQ(unread.attach(event.get()), 0);
  // Bounds the loop, so that a close that does not end it fails the test instead of hanging it.
  ASSERT_GE(
      sd_event_add_time_relative(
          event.get(), nullptr, CLOCK_MONOTONIC, 30'000'000, 0,
          [](sd_event_source* s, uint64_t, void*) { return sd_event_exit(sd_event_source_get_event(s), 1); }, nullptr),
      0);
  std::vector<int> ran;  // touched by the loop's thread only, read once it has ended
  std::jthread poster([&] {
    for (int i = 0; i < 100; ++i) EXPECT_TRUE(mailbox.post([&ran, i] { ran.push_back(i); }));
    EXPECT_TRUE(mailbox.close());
    EXPECT_FALSE(mailbox.post([&ran] { ran.push_back(-1); }));
    EXPECT_FALSE(mailbox.close());
  });
  EXPECT_EQ(sd_event_loop(event.get()), 0);
  poster.join();
  mailbox.drain();
  std::vector<int> expected(100);
  std::iota(expected.begin(), expected.end(), 0);
  EXPECT_EQ(ran, expected);

  // Posted after its loop ended: drain runs it, past work that throws, and refuses what it posts.
  std::vector<std::string> drained;
  EXPECT_TRUE(unread.post([&] { drained.push_back("first"); }));
  EXPECT_TRUE(unread.post([] { throw std::runtime_error("out of luck"); }));
  EXPECT_TRUE(unread.post([&] {
    drained.push_back("second");
    EXPECT_FALSE(unread.post([&] { drained.push_back("posted while draining"); }));
  }));
  unread.drain();
  EXPECT_EQ(drained, (std::vector<std::string>{"first", "second"}));
  EXPECT_EQ(log.count(platform::LogLevel::Error, "Messaging: work on the event loop failed: out of luck"), 1)
      << log.dump();
  EXPECT_FALSE(unread.post([] {}));
}
