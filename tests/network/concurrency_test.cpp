// Many requests at once: exactly one reply each, whatever goes wrong, and one session opening for
// many callers. Also run under ThreadSanitizer.
#include <latch>
#include <random>
#include <thread>

#include "network_fixture.h"

namespace nettest {
namespace {

[[maybe_unused]] ::testing::Environment* const kWorld =
    ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(true));

struct Slot {
  std::atomic<int> replies{0};
  std::atomic<bool> wellFormed{true};
  std::atomic<int64_t> code{0};  // 0: success
  platform::Semaphore first;

  void record(const Outcome& o, bool valuesExpected) {
    if (o.error ? o.hasValues || o.error->domain() != ZLKATokenManagerErrorDomain : valuesExpected && !o.hasValues)
      wellFormed = false;
    if (replies++ == 0) code = o.error ? o.error->code() : 0, first.signal();
  }
  void check(int i) {
    EXPECT_EQ(replies.load(), 1) << "request " << i;
    EXPECT_TRUE(wellFormed.load()) << "request " << i << ": values and error do not match";
  }
};

// A thousand operations of every kind from eight threads, a tenth from peers without the
// entitlement, against a server that misbehaves at random (seeded, so a failure can be replayed):
// each gets exactly one well-formed reply, and the gate always answers the same.
TEST_F(NetworkTest, EveryRequestGetsExactlyOneReply) {
  constexpr int kBatches = 20, kPerBatch = 50;
  std::mt19937 random(20240611);
  auto pick = [&](size_t n) { return std::uniform_int_distribution<size_t>(0, n - 1)(random); };
  // clang-format off
  const std::vector<json> faults = {
      {{"status", 400}}, {{"status", 401}}, {{"status", 204}}, {{"status", 500}}, {{"body", ""}}, {{"body", "garbage"}},
      {{"signature", "missing"}}, {{"signature", "corrupt"}}, {{"drop", true}}, {{"delay_ms", 30}},
      {{"endpoint", "setup.crt"}, {"status", 503}}, {{"endpoint", "sapSession"}, {"session_validity", 0}},
      {{"endpoint", "sapSession"}, {"drop", true}}};
  // clang-format on
  const char* const endpoints[] = {"queryProductPlan", "activateAccessory", "ackAccessory", "*"};
  auto entitled = peer(), outsider = peer(std::nullopt);
  std::vector<Slot> slots(kBatches * kPerBatch);
  for (int batch = 0; batch < kBatches; ++batch) {
    admin().clearFaults();
    for (size_t n = pick(3); n > 0; --n) {
      json fault = faults[pick(faults.size())];
      if (!fault.contains("endpoint")) fault["endpoint"] = endpoints[pick(4)];
      fault["remaining"] = 1 + pick(12);
      admin().setFault(fault);
    }
    std::atomic<int> next{batch * kPerBatch};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
      threads.emplace_back([&] {
        for (int i = next++; i < (batch + 1) * kPerBatch; i = next++) {
          platform::Connection::CurrentScope scope(i % 10 == 0 ? outsider.get() : entitled.get());
          const Op op = static_cast<Op>(i % 3);
          start({.op = op, .token = sampleToken("token-" + std::to_string(i))},
                [&slot = slots[i], op](Outcome o) { slot.record(o, op != Op::confirmation); });
          if (!slots[i].first.waitFor(kReplyGuard)) {
            ADD_FAILURE() << "request " << i << " got no reply";
            return;
          }
        }
      });
    }
    for (auto& t : threads) t.join();
  }
  network()->urlSession()->callbackQueue()->sync([] {});
  int successes = 0;
  for (int i = 0; i < kBatches * kPerBatch; ++i) {
    slots[i].check(i);
    EXPECT_TRUE(i % 10 || slots[i].code.load() == ZLKAErrorMissingEntitlement) << "request " << i;
    successes += slots[i].code.load() == 0;
  }
  EXPECT_GT(successes, 0);
}

// A hundred callers, each serving its own peer, whose requests all find the session closed: it
// opens once. As designed, the caller that opens it succeeds and callers that arrive while it
// opens fail fast as internal errors rather than wait.
TEST_F(NetworkTest, AHundredCallersOpenTheSessionOnce) {
  admin().setFault({{"endpoint", "setup.crt"}, {"delay_ms", 200}});  // keeps it opening while they pile up
  std::vector<Slot> slots(100);
  std::latch ready(100);
  std::vector<std::thread> callers;
  for (int i = 0; i < 100; ++i) {
    callers.emplace_back([&, i] {
      auto caller = peer();
      platform::Connection::CurrentScope scope(caller.get());
      ready.arrive_and_wait();
      start({.op = static_cast<Op>(i % 3)}, [&slot = slots[i], i](Outcome o) { slot.record(o, i % 3 != 2); });
    });
  }
  for (auto& t : callers) t.join();
  for (Slot& slot : slots) ASSERT_TRUE(slot.first.waitFor(kReplyGuard)) << "a caller got no reply";
  network()->urlSession()->callbackQueue()->sync([] {});
  int successes = 0;
  for (int i = 0; i < 100; ++i) {
    slots[i].check(i);
    successes += slots[i].code.load() == 0;
    EXPECT_TRUE(slots[i].code.load() == 0 || slots[i].code.load() == ZLKAErrorInternal) << slots[i].code.load();
  }
  EXPECT_GE(successes, 1);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().stat("handshakes"), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Tarvex SAP session opened!"), 1);
}

}  // namespace
}  // namespace nettest
