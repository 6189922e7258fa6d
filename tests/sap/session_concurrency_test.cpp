// What only the session owns when several things happen at once: late and duplicate delegate
// answers, expiration during an open, racing opens, a storm of mixed calls; and round trips with
// the real primitives and server.
#include <thread>

#include "session_fakes.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace saptest {
namespace {

const Error kTransport("SomeTransportDomain", -5);

// A late answer to an open that was closed and replaced by a newer one completes with the
// invalid-state error and touches nothing: no primitive call, no state change, no log line.
TEST_F(SessionTest, AStaleAnswerTouchesNothing) {
  delegate_->certificate = std::nullopt;
  auto stale = startOpen();
  ASSERT_TRUE(delegate_->waitHeld());
  session_->close();
  auto current = startOpen();
  ASSERT_TRUE(delegate_->waitHeld());
  flush();
  const auto events = primitives_->events();
  const size_t mark = log_.size();
  delegate_->release({Data::fromString("STALE")});
  auto result = stale->wait();
  ASSERT_TRUE(result);
  EXPECT_EQ(std::get<0>(*result), QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState));
  flush();
  EXPECT_EQ(primitives_->events(), events);
  EXPECT_EQ(stateInt(), 2u);
  EXPECT_EQ(log_.countStartingWith("[#TarvexSAPSession]", mark), 0) << log_.dump();
  delegate_->release({Data::fromString("CERT")});
  result = current->wait();
  ASSERT_TRUE(result);
  EXPECT_EQ(std::get<0>(*result), std::nullopt);
  EXPECT_EQ(stale->count(), 1);
}

// A delegate that calls a completion twice is heard once: the open succeeds, and a failure closes
// once (the three teardowns: the close, the reopen's expiration check, the failed open).
TEST_F(SessionTest, ADelegateAnsweringTwiceIsHeardOnce) {
  delegate_->calls = 2;
  openOrFail();
  EXPECT_EQ(primitives_->count("exchange"), 2);
  session_->close();
  delegate_->certificate = Answer{std::nullopt, kTransport};
  EXPECT_EQ(open(), kTransport);
  EXPECT_EQ(primitives_->count("teardown"), 3);
}

// A reopened session keeps the past expiration of its last close until the handshake answer sets
// a new one: nothing that runs meanwhile may tear down the context the open is using.
TEST_F(SessionTest, AnOpeningSessionNeverExpires) {
  openOrFail();
  session_->close();
  delegate_->ttl = std::nullopt;
  delegate_->certificate = delegate_->handshake = std::nullopt;
  auto reopened = startOpen();
  for (const char* answer : {"CERT", "INFO"}) {
    ASSERT_TRUE(delegate_->waitHeld());
    EXPECT_EQ(session_->state(), TarvexSAPSessionStateInitializing);
    EXPECT_EQ(sign(Value(Data::fromString("body"))).second->code(), TarvexSAPSessionErrorInvalidState);
    delegate_->release({Data::fromString(answer)});
  }
  auto result = reopened->wait();
  ASSERT_TRUE(result);
  EXPECT_EQ(std::get<0>(*result), std::nullopt);
  EXPECT_EQ(primitives_->events(), (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "teardown:1", "teardown:1", "init:2",
                                                             "exchange:2", "exchange:2"}));
  // Open now, with the old expiration: the next check closes it.
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
}

// Opens racing from eight threads: exactly one goes through; the others, and an open of an open
// session, are refused and change nothing.
TEST_F(SessionTest, OnlyOneOpenGoesThrough) {
  const Error refused = QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session is already open or initializing.");
  delegate_->certificate = std::nullopt;  // the winner stays opening until every other open has answered
  std::vector<std::shared_ptr<OpenRecorder>> opens(8);
  std::vector<std::thread> threads;
  for (auto& racer : opens) threads.emplace_back([&racer, this] { racer = startOpen(); });
  for (auto& t : threads) t.join();
  ASSERT_TRUE(delegate_->waitHeld());
  delegate_->release({Data::fromString("CERT")});
  int opened = 0;
  for (auto& racer : opens) {
    auto result = racer->wait();
    ASSERT_TRUE(result);
    opened += !std::get<0>(*result);
    EXPECT_EQ(std::get<0>(*result).value_or(refused), refused);
  }
  flush();
  EXPECT_EQ(opened, 1);
  for (auto& racer : opens) EXPECT_EQ(racer->count(), 1);
  EXPECT_EQ(open(), refused);
  EXPECT_EQ(primitives_->events(), (std::vector<std::string>{"init:1", "exchange:1", "exchange:1"}));
}

// Opens, closes, expirations, signatures, verifications and reads from four threads: every
// completion comes exactly once, and no primitive call uses a torn-down context (the fake fails
// the test if one does).
TEST_F(SessionTest, MixedCallsFromManyThreads) {
  std::mutex mutex;
  std::vector<std::pair<std::function<bool()>, std::function<int()>>> pending;  // wait, count
  auto keep = [&](auto recorder) {
    std::lock_guard lock(mutex);
    pending.emplace_back([recorder] { return recorder->wait().has_value(); }, [recorder] { return recorder->count(); });
    return recorder->handler(session_->completionQueue());
  };
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int round = 0; round < 150; ++round) {
        switch ((round + t) % 6) {
          case 0:
            session_->openWithCompletionHandler(keep(std::make_shared<OpenRecorder>()));
            break;
          case 1:
            session_->signatureForData(Data::fromString("b"), keep(std::make_shared<SignRecorder>()));
            break;
          case 2:
            session_->verifySignature(Data::fromString("RSP(b)"), Data::fromString("b"), keep(std::make_shared<VerifyRecorder>()));
            break;
          case 3:
            round % 3 ? session_->setTTL(round % 2 ? 3600.0 : -1.0) : session_->close();
            break;
          default:
            session_->description();
            break;
        }
      }
    });
  }
  for (auto& t : threads) t.join();
  for (auto& [wait, count] : pending) ASSERT_TRUE(wait());
  flush();
  for (auto& [wait, count] : pending) EXPECT_EQ(count(), 1);
}

// The transport's part, played by an in-process TarvexSAPServer: the certificate as served, and
// the handshake answer after the time-to-live is set.
class ServerDelegate : public TarvexSAPSessionDelegate {
 public:
  explicit ServerDelegate(TarvexSAPServer& server) : server_(server) {}
  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&, TarvexSAPDataCompletion completion) override {
    completion(Data(server_.setupCertificateDER()), std::nullopt);
  }
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session, const std::optional<Data>& request,
                                                          TarvexSAPDataCompletion completion) override {
    const auto answer = server_.handshake(session.UUID().UUIDString(), request->span(), std::chrono::seconds(3600));
    session.setTTL(3600);
    completion(Data(answer.sessionInfo.data(), answer.sessionInfo.size()), std::nullopt);
  }

 private:
  TarvexSAPServer& server_;
};

TEST_F(SessionTest, RoundTripsWithTheRealPrimitivesAndServer) {
  const TarvexSAPCredential root = TarvexSAPMakeRoot("Interop SAP Root");
  const TarvexSAPCredential setup = TarvexSAPIssueSetupCertificate(root, "Interop Setup");
  const std::string pem = TarvexSAPCertToPEM(root.certificate.get());
  const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(pem.data()), pem.size(), nullptr};
  ASSERT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
  TarvexSAPServer server(TarvexSAPCertToDER(setup.certificate.get()), setup.key.get());
  auto transport = std::make_shared<ServerDelegate>(server);
  session_ = TarvexSAPSession::sessionWithDelegate(transport);
  // Signed by the session, accepted by the server, answered, and the answer accepted: the seq the
  // server accepted, or 0.
  auto roundTrip = [&](const std::string& text) -> uint64_t {
    const Data body = Data::fromString(text);
    const std::optional<Data> signature = sign(Value(body)).first;
    if (!signature) return 0;
    const auto accepted = server.verifyRequest(session_->UUID().UUIDString(), signature->span(), body.span());
    const auto answer = server.signResponse(session_->UUID().UUIDString(), accepted.seq, body.span());
    const bool valid = verify(Value(Data(answer.signature.data(), answer.signature.size())), Value(body)).first;
    return accepted.status == TarvexSAPServerStatus::ok && valid ? accepted.seq : 0;
  };
  openOrFail();
  for (uint64_t seq = 1; seq <= 3; ++seq) EXPECT_EQ(roundTrip("request " + std::to_string(seq)), seq);
  // Past its expiration the session closes; a reopen makes a fresh association, and so does a
  // reopen after a close (whose handle the primitives then refuse to tear down twice).
  session_->setTTL(-1);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  openOrFail();
  EXPECT_EQ(roundTrip("fresh"), 1u);
  session_->close();
  openOrFail();
  EXPECT_EQ(roundTrip("after a close"), 1u);
}

}  // namespace
}  // namespace saptest
