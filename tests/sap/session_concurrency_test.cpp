// Many threads on one session: readers while it opens and works, racing opens, and a storm of
// mixed operations. Every completion must come exactly once, and nothing may deadlock or use a
// context that was torn down.
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>

#include "sap_test_support.h"
#include "session_server_delegate.h"

namespace saptest {
namespace {

using platform::Value;

// Calls state(), TTL() and description() until told to stop (bounded), checking what they say.
class Reader {
 public:
  Reader(TarvexSAPSession& session, const std::atomic<bool>& stop) {
    thread_ = std::thread([this, &session, &stop] {
      int last = TarvexSAPSessionStateClosed;
      for (int i = 0; i < 20000 && !stop.load(); ++i) {
        const int state = session.state();
        if (state < last) regressions_++;  // this session never closes while read
        last = state;
        const double ttl = session.TTL();
        if (ttl < 0.0 || ttl > 3600.0) badTTLs_++;
        if (!wellFormed(session.description())) badDescriptions_++;
        ++reads_;
      }
    });
  }
  void join() { thread_.join(); }

  // "TarvexSAPSession <state: [Open], TTL: 3599.998000s>" (no regex: its locale cache is not
  // thread-safe under the race detector).
  static bool wellFormed(const std::string& d) {
    for (const char* name : {"[Closed]", "[Initializing]", "[Open]"}) {
      const std::string head = std::string("TarvexSAPSession <state: ") + name + ", TTL: ";
      if (d.rfind(head, 0) != 0 || d.size() < head.size() + 10 || d.compare(d.size() - 2, 2, "s>") != 0) continue;
      const std::string number = d.substr(head.size(), d.size() - head.size() - 2);
      const size_t dot = number.find('.');
      return dot != std::string::npos && number.size() - dot == 7 &&
             number.find_first_not_of("-0123456789.") == std::string::npos;
    }
    return false;
  }
  int reads() const { return reads_; }
  int problems() const { return regressions_ + badTTLs_ + badDescriptions_; }

 private:
  std::thread thread_;
  int reads_ = 0, regressions_ = 0, badTTLs_ = 0, badDescriptions_ = 0;
};

TEST(SessionConcurrencyTest, ReadersWhileTheSessionOpensSignsAndVerifies) {
  LogCapture quiet;
  TestPKI pki = TestPKI::make("Concurrency");
  pki.trust();
  auto server = pki.server();
  auto delegate = std::make_shared<ServerDelegate>(*server, pki.setupDER);
  LifetimeProbe lifetime;
  auto session = TarvexSAPSession::sessionWithDelegate(delegate, libraryPrimitives(lifetime.token()));
  const std::string id = session->UUID().UUIDString();

  std::atomic<bool> stop{false};
  std::vector<std::unique_ptr<Reader>> readers;
  for (int i = 0; i < 3; ++i) readers.push_back(std::make_unique<Reader>(*session, stop));

  ASSERT_FALSE(openSession(*session).has_value());

  // Round trips chained through the completions: sign, server check and answer, verify.
  constexpr int kRoundTrips = 300;
  std::atomic<int> signCalls{0}, verifyCalls{0}, valid{0}, failures{0};
  platform::Semaphore finished;
  const auto start = [&](int n) {
    const Data body = dataOf("request " + std::to_string(n));
    session->signatureForData(body, [&, body](std::optional<Data> signature, std::optional<Error> error) {
      ++signCalls;
      if (!signature || error) {
        ++failures;
        finished.signal();
        return;
      }
      const auto accepted = server->verifyRequest(id, signature->span(), body.span());
      const Data answer = dataOf("answer to " + std::string(body.view()));
      const auto signed1 = server->signResponse(id, accepted.seq, answer.span());
      if (accepted.status != TarvexSAPServerStatus::ok || signed1.status != TarvexSAPServerStatus::ok) {
        ++failures;
        finished.signal();
        return;
      }
      session->verifySignature(Data(signed1.signature.data(), signed1.signature.size()), answer,
                               [&](bool ok, std::optional<Error> verifyError) {
                                 ++verifyCalls;
                                 if (ok && !verifyError) ++valid;
                                 finished.signal();
                               });
    });
  };
  std::thread submitterA([&] {
    for (int n = 0; n < kRoundTrips; n += 2) start(n);
  });
  std::thread submitterB([&] {
    for (int n = 1; n < kRoundTrips; n += 2) start(n);
  });
  submitterA.join();
  submitterB.join();
  int done = 0;
  while (done < kRoundTrips && finished.waitFor(kGuard)) ++done;
  stop = true;
  for (auto& r : readers) r->join();
  ASSERT_EQ(done, kRoundTrips) << "round trips stalled";

  // Nothing runs twice late: flush every queue, then count.
  flushQueues(*session);
  EXPECT_EQ(signCalls.load(), kRoundTrips);
  EXPECT_EQ(verifyCalls.load(), kRoundTrips);
  EXPECT_EQ(valid.load(), kRoundTrips);
  EXPECT_EQ(failures.load(), 0);
  for (auto& r : readers) {
    EXPECT_GT(r->reads(), 0);
    EXPECT_EQ(r->problems(), 0);
  }
  EXPECT_EQ(session->state(), TarvexSAPSessionStateOpen);

  releaseSession(session, lifetime);
}

class SessionRaceTest : public SessionTest {};

TEST_F(SessionRaceTest, RacingOpensLetExactlyOneThrough) {
  constexpr int kThreads = 8;
  delegate_->certificate.hold();  // keep the winner opening until every other open has answered
  std::vector<std::shared_ptr<OpenRecorder>> opens;
  for (int i = 0; i < kThreads; ++i) opens.push_back(std::make_shared<OpenRecorder>());
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i)
    threads.emplace_back([&, i] { session_->openWithCompletionHandler(opens[i]->handler()); });
  for (auto& t : threads) t.join();
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  flush();
  int refused = 0;
  for (auto& o : opens) {
    if (o->calls() == 0) continue;
    expectSessionError(std::get<0>(o->result()), -7, "Session is already open or initializing.");
    ++refused;
  }
  EXPECT_EQ(refused, kThreads - 1);
  delegate_->certificate.release({dataOf("CERT"), std::nullopt});
  int opened = 0;
  for (auto& o : opens) {
    ASSERT_TRUE(o->wait());
    if (!std::get<0>(o->result())) ++opened;
  }
  flush();
  EXPECT_EQ(opened, 1);
  for (auto& o : opens) EXPECT_EQ(o->calls(), 1);
  EXPECT_EQ(layer_->initCalls(), 1);
}

TEST_F(SessionRaceTest, MixedOperationsFromManyThreads) {
  constexpr int kThreads = 4;
  constexpr int kRounds = 150;
  std::atomic<int> issued{0};
  std::vector<std::shared_ptr<OpenRecorder>> opens;
  std::vector<std::shared_ptr<SignRecorder>> signs;
  std::vector<std::shared_ptr<VerifyRecorder>> verifies;
  std::mutex recordersMutex;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int round = 0; round < kRounds; ++round) {
        switch ((round + t) % 7) {
          case 0:
          case 4: {
            auto r = std::make_shared<OpenRecorder>();
            session_->openWithCompletionHandler(r->handler());
            std::lock_guard lock(recordersMutex);
            opens.push_back(r);
            break;
          }
          case 1:
          case 5: {
            auto r = std::make_shared<SignRecorder>();
            session_->signatureForData(dataOf("b"), r->handler());
            std::lock_guard lock(recordersMutex);
            signs.push_back(r);
            break;
          }
          case 2: {
            auto r = std::make_shared<VerifyRecorder>();
            session_->verifySignature(dataOf("RSP(b)"), dataOf("b"), r->handler());
            std::lock_guard lock(recordersMutex);
            verifies.push_back(r);
            break;
          }
          case 3:
            if (round % 3 == 0) session_->close();
            else session_->setTTL(round % 2 ? 3600.0 : -1.0);
            break;
          default:
            (void)session_->state();
            (void)session_->description();
            break;
        }
        ++issued;
      }
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(issued.load(), kThreads * kRounds);

  // Every open, signature and verification completes exactly once.
  std::lock_guard lock(recordersMutex);
  for (auto& r : opens) ASSERT_TRUE(r->wait());
  for (auto& r : signs) ASSERT_TRUE(r->wait());
  for (auto& r : verifies) ASSERT_TRUE(r->wait());
  flush();
  flush();
  int signed1 = 0;
  for (auto& r : opens) EXPECT_EQ(r->calls(), 1);
  for (auto& r : signs) {
    EXPECT_EQ(r->calls(), 1);
    if (std::get<0>(r->result())) ++signed1;
  }
  for (auto& r : verifies) EXPECT_EQ(r->calls(), 1);
  EXPECT_EQ(static_cast<size_t>(signed1), layer_->signs().size());
  EXPECT_TRUE(layer_->deadHandleUses().empty()) << ::testing::PrintToString(layer_->deadHandleUses());
}

}  // namespace
}  // namespace saptest
