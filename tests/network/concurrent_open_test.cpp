// A hundred callers, each serving its own peer, whose first requests all find the session closed:
// the session opens once, and every caller gets exactly one reply. Callers that arrive while it
// opens fail fast with an internal error rather than wait; the one that opens it succeeds.
#include <atomic>
#include <latch>
#include <thread>
#include <vector>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/semaphore.h"
#include "support/errors.h"

namespace nettest {
namespace {

using platform::Data;
using platform::Error;
using platform::LogLevel;

struct Answer {
  std::atomic<int> replies{0};
  std::optional<int64_t> code;  // written before the first signal, read after it
  platform::Semaphore first;

  void record(const std::optional<Error>& error) {
    if (replies.fetch_add(1) == 0) {
      if (error) code = error->code();
      first.signal();
    }
  }
};

class ConcurrentOpenTest : public NetworkTest {};

TEST_F(ConcurrentOpenTest, HundredCallersOpenTheSessionOnce) {
  constexpr int kCallers = 100;
  // A slow certificate keeps the session opening while the callers pile up.
  admin().setFault({{"endpoint", "setup.crt"}, {"delay_ms", 200}});
  ASSERT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateClosed);

  std::vector<std::unique_ptr<Answer>> answers;
  for (int i = 0; i < kCallers; ++i) answers.push_back(std::make_unique<Answer>());
  std::latch start(kCallers);
  std::vector<std::thread> callers;
  for (int i = 0; i < kCallers; ++i) {
    callers.emplace_back([&, i] {
      auto peer = entitledPeer();
      platform::Connection::CurrentScope scope(peer.get());
      Answer* answer = answers[i].get();
      auto network = ZLKANetwork::sharedInstance();
      start.arrive_and_wait();
      switch (i % 3) {
        case 0:
          network->requestMetadataForToken(
              sampleToken(), std::string(kSampleUUID), platform::Locale("en_US"), std::nullopt,
              [answer](auto, auto, auto, std::optional<Error> error) { answer->record(error); });
          break;
        case 1:
          network->requestActivationForToken(
              sampleToken(), std::string(kSampleUUID),
              [answer](std::optional<Data>, std::optional<Error> error) { answer->record(error); });
          break;
        default:
          network->confirmActivationForToken(sampleToken(), std::string(kSampleUUID),
                                             [answer](std::optional<Error> error) { answer->record(error); });
      }
    });
  }
  for (auto& t : callers) t.join();
  for (int i = 0; i < kCallers; ++i)
    ASSERT_TRUE(answers[i]->first.waitFor(kReplyGuard)) << "caller " << i << " got no reply";
  drainReplies();

  int successes = 0;
  for (int i = 0; i < kCallers; ++i) {
    EXPECT_EQ(answers[i]->replies.load(), 1) << "caller " << i;
    if (!answers[i]->code) {
      ++successes;
    } else {
      EXPECT_EQ(*answers[i]->code, ZLKAErrorInternal) << "caller " << i;
    }
  }
  RecordProperty("successes", successes);
  EXPECT_GE(successes, 1);
  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().requests("sapSession"), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Tarvex SAP session opened!"), 1);
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateOpen);
}

}  // namespace
}  // namespace nettest
