// Many requests at once: exactly one reply each, whatever goes wrong, and one session opening for
// many callers. Also run under ThreadSanitizer.
#include <latch>
#include <random>
#include <thread>

#include "network/zlka_network_constants.h"
#include "network_fixture.h"
#include "platform/semaphore.h"

namespace nettest {
namespace {

[[maybe_unused]] ::testing::Environment* const kWorld = ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(true));

struct Slot {
  std::atomic<int> replies{0};
  std::atomic<bool> wellFormed{true};
  std::atomic<int64_t> code{0};  // 0: success
  platform::Semaphore first;

  void record(const Outcome& o, bool valuesExpected) {
    if (o.error ? o.hasValues || o.error->domain() != ZLKATokenManagerErrorDomain : valuesExpected && !o.hasValues) wellFormed = false;
    if (replies++ == 0) {
      code = o.error ? o.error->code() : 0;
      first.signal();
    }
  }
};

// A thousand operations of every kind from eight threads, some with bad arguments or from peers
// without the entitlement, against a server that misbehaves at random (seeded, so a failure can
// be replayed) with switches turned on at times: each gets exactly one well-formed reply, and the
// gate and the argument checks always answer the same.
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
  const char* const switches[] = {ZLKAUserDefaultsKey_ForceNetworkFailure, ZLKAUserDefaultsKey_ForceTokenActivationFailure,
                                  ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, ZLKAUserDefaultsKey_ForceTarvexSAPFailure};
  auto entitled = peer(), outsider = peer(std::nullopt);
  std::vector<Slot> slots(kBatches * kPerBatch);
  // The request's kind and flaw follow from its number: 0 no entitlement, 1 no uuid, 2 not DER,
  // 3 an unknown locale, 4 request info that JSON cannot hold (the last two: the query only).
  auto flaw = [](int i) { return (i / 3) % 10; };
  for (int batch = 0; batch < kBatches; ++batch) {
    admin().clearFaults();
    suite().clear();
    for (size_t n = pick(3); n > 0; --n) {
      json fault = faults[pick(faults.size())];
      if (!fault.contains("endpoint")) fault["endpoint"] = endpoints[pick(4)];
      fault["remaining"] = 1 + pick(12);
      admin().setFault(fault);
    }
    if (pick(5) == 0) suite().set(switches[pick(4)], true);
    std::atomic<int> next{batch * kPerBatch};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
      threads.emplace_back([&] {
        for (int i = next++; i < (batch + 1) * kPerBatch; i = next++) {
          Call call{.op = static_cast<Op>(i % 3), .token = sampleToken("token-" + std::to_string(i)), .uuid = "uuid-" + std::to_string(i)};
          if (flaw(i) == 1) call.uuid = std::nullopt;
          if (flaw(i) == 2) call.token = Data::fromString("\x30\x7f short");
          if (flaw(i) == 3) call.locale = "xx_ZZ";
          if (flaw(i) == 4) call.requestInfo = platform::Dictionary{{"raw", Data::fromString("x")}};
          platform::Connection::CurrentScope scope(flaw(i) == 0 ? outsider.get() : entitled.get());
          Slot& slot = slots[i];
          start(call, [&slot, valuesExpected = call.op != Op::confirmation](Outcome o) { slot.record(o, valuesExpected); });
          if (!slot.first.waitFor(kReplyGuard)) {
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
    EXPECT_EQ(slots[i].replies.load(), 1) << "request " << i;
    EXPECT_TRUE(slots[i].wellFormed.load()) << "request " << i << ": values and error do not match";
    if (flaw(i) == 0) {
      EXPECT_EQ(slots[i].code.load(), ZLKAErrorMissingEntitlement) << "request " << i;
    } else if (flaw(i) == 1 || (flaw(i) == 3 && i % 3 == 0)) {
      EXPECT_EQ(slots[i].code.load(), ZLKAErrorInvalidParameter) << "request " << i;
    }
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
  for (Slot& slot : slots) {
    EXPECT_EQ(slot.replies.load(), 1);
    EXPECT_TRUE(slot.wellFormed.load());
    if (slot.code.load() != 0) {
      EXPECT_EQ(slot.code.load(), ZLKAErrorInternal);
    }
    successes += slot.code.load() == 0;
  }
  EXPECT_GE(successes, 1);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Tarvex SAP session opened!"), 1);
}

}  // namespace
}  // namespace nettest
