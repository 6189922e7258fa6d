// The session over the real device-side primitives, talking to a TarvexSAPServer through an
// in-process delegate: handshake, signed requests and answers, and every way they must fail.
#include <gtest/gtest.h>

#include <atomic>

#include "sap_test_support.h"
#include "session_server_delegate.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace saptest {
namespace {

using platform::Value;

class SessionInteropTest : public ::testing::Test {
 protected:
  void SetUp() override {
    pki_ = TestPKI::make("Interop");
    pki_.trust();
    server_ = pki_.server();
    delegate_ = std::make_shared<ServerDelegate>(*server_, pki_.setupDER);
    session_ = TarvexSAPSession::sessionWithDelegate(delegate_, libraryPrimitives(lifetime_.token()));
  }
  void TearDown() override { releaseSession(session_, lifetime_); }

  std::string id() const { return session_->UUID().UUIDString(); }

  void openOrFail() {
    const auto error = openSession(*session_);
    ASSERT_FALSE(error.has_value()) << error->description();
    ASSERT_EQ(session_->state(), TarvexSAPSessionStateOpen);
  }

  // Signs `body` through the session and has the server accept it; returns the accepted seq.
  uint64_t requestAccepted(const Data& body) {
    const auto [signature, error] = signWith(*session_, Value(body));
    EXPECT_FALSE(error.has_value());
    if (!signature) {
      ADD_FAILURE() << "no signature";
      return 0;
    }
    EXPECT_EQ(signature->length(), 40u);
    const auto accepted = server_->verifyRequest(id(), signature->span(), body.span());
    EXPECT_EQ(accepted.status, TarvexSAPServerStatus::ok) << TarvexSAPServerStatusName(accepted.status);
    return accepted.seq;
  }

  Data responseSignature(uint64_t seq, const Data& body) {
    const auto signed1 = server_->signResponse(id(), seq, body.span());
    EXPECT_EQ(signed1.status, TarvexSAPServerStatus::ok);
    return Data(signed1.signature.data(), signed1.signature.size());
  }

  void expectRejected(const Data& signature, const Data& body) {
    const auto [valid, error] = verifyWith(*session_, Value(signature), Value(body));
    EXPECT_FALSE(valid);
    expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
    EXPECT_EQ(session_->state(), TarvexSAPSessionStateOpen) << "a rejected answer must not close the session";
  }

  void expectAccepted(const Data& signature, const Data& body) {
    const auto [valid, error] = verifyWith(*session_, Value(signature), Value(body));
    EXPECT_TRUE(valid);
    EXPECT_FALSE(error.has_value());
  }

  LogCapture log_;
  TestPKI pki_;
  std::unique_ptr<TarvexSAPServer> server_;
  std::shared_ptr<ServerDelegate> delegate_;
  LifetimeProbe lifetime_;
  std::shared_ptr<TarvexSAPSession> session_;
};

TEST_F(SessionInteropTest, SignedRequestsAndAnswersRoundTrip) {
  openOrFail();
  EXPECT_GT(session_->TTL(), 3500.0);
  EXPECT_EQ(server_->associationCount(), 1u);
  for (uint64_t round = 1; round <= 16; ++round) {
    const Data body = dataOf("{\"round\":" + std::to_string(round) + "}");
    EXPECT_EQ(requestAccepted(body), round);
    const Data answer = dataOf("answer " + std::to_string(round));
    expectAccepted(responseSignature(round, answer), answer);
  }
}

TEST_F(SessionInteropTest, EmptyBodiesRoundTrip) {
  openOrFail();
  const uint64_t seq = requestAccepted(Data());
  expectAccepted(responseSignature(seq, Data()), Data());
}

TEST_F(SessionInteropTest, HandshakeRequestCarriesTheHardwareIdentifier) {
  openOrFail();
  const auto requests = delegate_->requests();
  ASSERT_EQ(requests.size(), 1u);
  ASSERT_EQ(requests[0].size(), 90u);
  EXPECT_EQ(std::string(reinterpret_cast<const char*>(requests[0].data()), 4), "TSAP");
  EXPECT_EQ(requests[0][5], 20u) << "the layer fills the session's zeroed hardware record";
}

TEST_F(SessionInteropTest, ServerRefusesTamperedRequests) {
  openOrFail();
  const Data body = dataOf("transfer 10");
  const auto [signature, error] = signWith(*session_, Value(body));
  ASSERT_TRUE(signature.has_value());
  const Data tampered = dataOf("transfer 99");
  EXPECT_EQ(server_->verifyRequest(id(), signature->span(), tampered.span()).status, TarvexSAPServerStatus::badSignature);
  std::vector<uint8_t> badSignature = signature->toVector();
  badSignature[20] ^= 0x01;
  EXPECT_EQ(server_->verifyRequest(id(), badSignature, body.span()).status, TarvexSAPServerStatus::badSignature);
  EXPECT_EQ(server_->verifyRequest(id(), signature->span(), body.span()).status, TarvexSAPServerStatus::ok);
  EXPECT_EQ(server_->verifyRequest(id(), signature->span(), body.span()).status, TarvexSAPServerStatus::replay);
}

TEST_F(SessionInteropTest, TamperedAnswerBodyIsRejected) {
  openOrFail();
  const uint64_t seq = requestAccepted(dataOf("request"));
  const Data answer = dataOf("{\"ok\":true}");
  const Data signature = responseSignature(seq, answer);
  expectRejected(signature, dataOf("{\"ok\":false}"));
  // The failed attempt did not use up the seq.
  expectAccepted(signature, answer);
}

TEST_F(SessionInteropTest, TamperedAnswerSignatureIsRejected) {
  openOrFail();
  const uint64_t seq = requestAccepted(dataOf("request"));
  const Data answer = dataOf("answer");
  const std::vector<uint8_t> good = responseSignature(seq, answer).toVector();
  for (size_t at : {size_t{7}, size_t{8}, size_t{39}}) {
    std::vector<uint8_t> bad = good;
    bad[at] ^= 0x80;
    expectRejected(Data(bad), answer);
  }
  expectRejected(Data(std::vector<uint8_t>(good.begin(), good.end() - 1)), answer);
  expectAccepted(Data(good), answer);
}

TEST_F(SessionInteropTest, ReplayedAnswerIsRejected) {
  openOrFail();
  const uint64_t seq = requestAccepted(dataOf("request"));
  const Data answer = dataOf("answer");
  const Data signature = responseSignature(seq, answer);
  expectAccepted(signature, answer);
  expectRejected(signature, answer);
}

TEST_F(SessionInteropTest, AnswerToAnUnissuedSeqIsRejected) {
  openOrFail();
  requestAccepted(dataOf("request"));
  const Data answer = dataOf("answer");
  expectRejected(responseSignature(777, answer), answer);
}

TEST_F(SessionInteropTest, RequestSignatureDoesNotPassAsAnswerSignature) {
  openOrFail();
  const Data body = dataOf("same bytes both ways");
  const auto [signature, error] = signWith(*session_, Value(body));
  ASSERT_TRUE(signature.has_value());
  expectRejected(*signature, body);
}

TEST_F(SessionInteropTest, ReopenAfterExpiryMakesAFreshAssociation) {
  openOrFail();
  const uint64_t seq = requestAccepted(dataOf("first"));
  const Data oldAnswer = dataOf("old answer");
  const Data oldAnswerSignature = responseSignature(seq, oldAnswer);
  const auto [oldRequestSignature, unused] = signWith(*session_, Value(dataOf("second")));
  ASSERT_TRUE(oldRequestSignature.has_value());

  session_->setTTL(-1);
  const auto [none, expired] = signWith(*session_, Value(dataOf("third")));
  EXPECT_FALSE(none.has_value());
  expectSessionError(expired, -7, "Session must be open to generate signature.");
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);

  openOrFail();
  EXPECT_EQ(delegate_->requests().size(), 2u);
  EXPECT_NE(delegate_->requests()[0], delegate_->requests()[1]);
  EXPECT_GT(session_->TTL(), 3500.0);
  // New keys: the seq restarts, and nothing of the old association is accepted either way.
  EXPECT_EQ(requestAccepted(dataOf("fresh")), 1u);
  EXPECT_EQ(server_->verifyRequest(id(), oldRequestSignature->span(), dataOf("second").span()).status,
            TarvexSAPServerStatus::badSignature);
  expectRejected(oldAnswerSignature, oldAnswer);
}

TEST_F(SessionInteropTest, ClosedSessionReopensThoughTheOldContextIsGone) {
  openOrFail();
  session_->close();
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  expectSessionError(signWith(*session_, Value(dataOf("x"))).second, -7, "Session must be open to generate signature.");
  // The reopen tears the old handle down once more; the layer refuses it and the session only logs.
  openOrFail();
  EXPECT_GE(log_.count(platform::LogLevel::Error, "[#TarvexSAPSession] Could not tear down Tarvex SAP session!"), 1);
  EXPECT_EQ(requestAccepted(dataOf("after reopen")), 1u);
}

struct RefusedCertificate {
  const char* name;
  std::function<Bytes(const TestPKI& trusted)> certificate;
};

class SessionRefusedCertificateTest : public SessionInteropTest,
                                      public ::testing::WithParamInterface<RefusedCertificate> {};

TEST_P(SessionRefusedCertificateTest, OpenFailsBeforeAnyHandshake) {
  delegate_->setCertificate(GetParam().certificate(pki_));
  expectSessionError(openSession(*session_), -4, "An internal error has occurred.");
  EXPECT_EQ(delegate_->requests().size(), 0u);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  EXPECT_EQ(log_.countStartingWith("[#TarvexSAPSession] Could not generate handshake request data! (status: "), 1);

  // Closed, and can be opened again once the right certificate is served.
  delegate_->setCertificate(pki_.setupDER);
  openOrFail();
}

INSTANTIATE_TEST_SUITE_P(
    Certificates, SessionRefusedCertificateTest,
    ::testing::Values(
        RefusedCertificate{"FromAnotherRoot", [](const TestPKI&) { return TestPKI::make("Rogue").setupDER; }},
        RefusedCertificate{"Expired",
                           [](const TestPKI& trusted) {
                             const TarvexSAPValidity past{std::chrono::hours(-48), std::chrono::hours(-24)};
                             return TarvexSAPCertToDER(
                                 TarvexSAPIssueSetupCertificate(trusted.root, "Expired Setup", past).certificate.get());
                           }},
        RefusedCertificate{"NotYetValid",
                           [](const TestPKI& trusted) {
                             const TarvexSAPValidity future{std::chrono::hours(24), std::chrono::hours(48)};
                             return TarvexSAPCertToDER(
                                 TarvexSAPIssueSetupCertificate(trusted.root, "Early Setup", future).certificate.get());
                           }},
        RefusedCertificate{"RootItself",
                           [](const TestPKI& trusted) { return TarvexSAPCertToDER(trusted.root.certificate.get()); }},
        RefusedCertificate{"NotACertificate", [](const TestPKI&) { return Bytes{'n', 'o', 'p', 'e'}; }}),
    [](const ::testing::TestParamInfo<RefusedCertificate>& info) { return std::string(info.param.name); });

TEST_F(SessionInteropTest, SessionInfoFromAnUncertifiedKeyIsRefused) {
  // The trusted certificate is served, but the handshake is answered by a server holding
  // another key.
  const TestPKI rogue = TestPKI::make("Rogue");
  auto impostor = rogue.server();
  delegate_->setServer(*impostor);
  expectSessionError(openSession(*session_), -4, "An internal error has occurred.");
  EXPECT_EQ(delegate_->requests().size(), 1u);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  EXPECT_EQ(log_.countStartingWith("[#TarvexSAPSession] Could not process handshake response! (status: "), 1);

  delegate_->setServer(*server_);
  openOrFail();
}

TEST_F(SessionInteropTest, CorruptedSessionInfoIsRefused) {
  delegate_->corruptSessionInfo(true);
  expectSessionError(openSession(*session_), -4, "An internal error has occurred.");
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
}

}  // namespace
}  // namespace saptest
