// Exactly one reply per request, whatever goes wrong: a thousand operations of every kind, some
// with bad arguments or from peers without the entitlement, against a server that misbehaves at
// random (seeded, so a failure can be replayed).
#include <atomic>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/semaphore.h"
#include "support/errors.h"

namespace nettest {
namespace {

using nlohmann::json;
using platform::Data;
using platform::Error;

enum class Kind { metadata, activation, confirmation };
enum class Variant { normal, nilArgument, badToken, unknownLocale, notEntitled, unserialisable };

struct Planned {
  Kind kind;
  Variant variant;
};

// What one request's reply calls delivered.
struct Slot {
  std::atomic<int> replies{0};
  std::atomic<bool> wellFormed{true};
  std::mutex mutex;
  std::optional<int64_t> code;  // nullopt: success
  platform::Semaphore first;

  void record(bool hasValues, const std::optional<Error>& error) {
    const bool ok = error ? (!hasValues && error->domain() == ZLKATokenManagerErrorDomain && error->code() <= -2 &&
                             error->code() >= -6)
                          : hasValues;
    if (!ok) wellFormed = false;
    if (replies.fetch_add(1) == 0) {
      {
        std::lock_guard lock(mutex);
        if (error) code = error->code();
      }
      first.signal();
    }
  }
};

const std::vector<json>& serverFaults() {
  static const std::vector<json> all = {
      {{"status", 400}},
      {{"status", 401}},
      {{"status", 201}},
      {{"status", 204}},
      {{"status", 302}},
      {{"status", 500}},
      {{"body", ""}},
      {{"body", "garbage"}},
      {{"body", R"({"tokens":["AQID"]})"}},
      {{"body", R"({"ppid":"PP-1"})"}},
      {{"signature", "missing"}},
      {{"signature", "corrupt"}},
      {{"drop", true}},
      {{"delay_ms", 30}},
  };
  return all;
}

const std::vector<json>& sessionFaults() {
  static const std::vector<json> all = {
      {{"endpoint", "setup.crt"}, {"status", 503}},          {{"endpoint", "setup.crt"}, {"drop", true}},
      {{"endpoint", "sapSession"}, {"session_validity", 0}}, {{"endpoint", "sapSession"}, {"session_info", "!!"}},
      {{"endpoint", "sapSession"}, {"status", 500}},         {{"endpoint", "sapSession"}, {"drop", true}},
  };
  return all;
}

class ReplyOnceTest : public NetworkTest {};

TEST_F(ReplyOnceTest, EveryOneOfAThousandRequestsGetsExactlyOneReply) {
  constexpr int kOperations = 1000;
  constexpr int kBatches = 20;
  constexpr int kThreads = 8;
  std::mt19937 random(20240611);
  auto chance = [&](int percent) { return std::uniform_int_distribution<int>(0, 99)(random) < percent; };
  auto pick = [&](size_t n) { return std::uniform_int_distribution<size_t>(0, n - 1)(random); };

  std::vector<Planned> plan(kOperations);
  for (Planned& p : plan) {
    p.kind = static_cast<Kind>(pick(3));
    const int roll = std::uniform_int_distribution<int>(0, 99)(random);
    p.variant = roll < 80   ? Variant::normal
                : roll < 84 ? Variant::nilArgument
                : roll < 88 ? Variant::badToken
                : roll < 92 ? Variant::notEntitled
                : roll < 96 ? (p.kind == Kind::metadata ? Variant::unknownLocale : Variant::normal)
                            : (p.kind == Kind::metadata ? Variant::unserialisable : Variant::normal);
  }
  std::vector<std::unique_ptr<Slot>> slots;
  for (int i = 0; i < kOperations; ++i) slots.push_back(std::make_unique<Slot>());

  const char* const tokenEndpoints[] = {"queryProductPlan", "activateAccessory", "ackAccessory", "*"};
  const char* const switchKeys[] = {
      ZLKAUserDefaultsKey_ForceNetworkFailure, ZLKAUserDefaultsKey_ForceTokenActivationFailure,
      ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, ZLKAUserDefaultsKey_ForceTarvexSAPFailure};
  auto peer = entitledPeer();
  auto outsider = peerWithEntitlement(std::nullopt);

  for (int batch = 0; batch < kBatches; ++batch) {
    admin().clearFaults();
    for (int n = static_cast<int>(pick(3)); n > 0; --n) {
      json fault = serverFaults()[pick(serverFaults().size())];
      fault["endpoint"] = tokenEndpoints[pick(4)];
      fault["remaining"] = static_cast<int>(1 + pick(12));
      admin().setFault(fault);
    }
    if (chance(30)) {
      json fault = sessionFaults()[pick(sessionFaults().size())];
      fault["remaining"] = 1;
      admin().setFault(fault);
    }
    suite().clear();
    if (chance(20)) suite().set(switchKeys[pick(4)], true);

    const int begin = batch * kOperations / kBatches;
    const int end = (batch + 1) * kOperations / kBatches;
    std::atomic<int> next{begin};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&] {
        for (int i = next++; i < end; i = next++) {
          const Planned& p = plan[i];
          Slot* slot = slots[i].get();
          platform::Connection::CurrentScope scope(p.variant == Variant::notEntitled ? outsider.get() : peer.get());
          std::optional<Data> token = sampleToken("token-" + std::to_string(i));
          std::optional<std::string> uuid = "uuid-" + std::to_string(i);
          if (p.variant == Variant::nilArgument) {
            if (i % 2)
              token = std::nullopt;
            else
              uuid = std::nullopt;
          }
          if (p.variant == Variant::badToken) token = Data::fromString("\x30\x7f short");
          auto network = ZLKANetwork::sharedInstance();
          switch (p.kind) {
            case Kind::metadata: {
              std::optional<platform::Locale> locale =
                  platform::Locale(p.variant == Variant::unknownLocale ? "xx_ZZ" : "en_GB");
              std::optional<platform::Dictionary> info;
              if (p.variant == Variant::unserialisable) info = platform::Dictionary{{"raw", Data::fromString("x")}};
              network->requestMetadataForToken(
                  token, uuid, locale, info,
                  [slot](std::optional<std::string> ppid, std::optional<platform::Locale> l,
                         std::optional<platform::Dictionary> m,
                         std::optional<Error> error) { slot->record(ppid && l && m, error); });
              break;
            }
            case Kind::activation:
              network->requestActivationForToken(token, uuid,
                                                 [slot](std::optional<Data> newToken, std::optional<Error> error) {
                                                   slot->record(newToken.has_value(), error);
                                                 });
              break;
            case Kind::confirmation:
              network->confirmActivationForToken(token, uuid,
                                                 [slot](std::optional<Error> error) { slot->record(!error, error); });
              break;
          }
          if (!slot->first.waitFor(kReplyGuard)) {
            ADD_FAILURE() << "request " << i << " got no reply";
            return;
          }
        }
      });
    }
    for (auto& t : threads) t.join();
  }
  drainReplies();

  int successes = 0;
  std::map<int64_t, int> failures;
  for (int i = 0; i < kOperations; ++i) {
    const Slot& slot = *slots[i];
    EXPECT_EQ(slot.replies.load(), 1) << "request " << i;
    EXPECT_TRUE(slot.wellFormed.load()) << "request " << i << ": values and error do not match";
    // The gate and the argument checks come before any switch or server: their answers are fixed.
    if (plan[i].variant == Variant::notEntitled) {
      EXPECT_EQ(slot.code, ZLKAErrorMissingEntitlement) << "request " << i;
    } else if (plan[i].variant == Variant::nilArgument || plan[i].variant == Variant::unknownLocale) {
      EXPECT_EQ(slot.code, ZLKAErrorInvalidParameter) << "request " << i;
    }
    if (slot.code) {
      ++failures[*slot.code];
    } else {
      ++successes;
    }
  }
  RecordProperty("successes", successes);
  for (const auto& [code, n] : failures) RecordProperty("code" + std::to_string(code), n);
  EXPECT_GT(successes, 0);
}

}  // namespace
}  // namespace nettest
