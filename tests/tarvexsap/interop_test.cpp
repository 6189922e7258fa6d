// Device and server together: handshake, then request/response signatures in both directions.
#include "tsap_test_support.h"

#include <gtest/gtest.h>

using namespace tsaptest;

namespace {

class InteropTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Interop");
        pki_.trust();
        server_ = pki_.server();
    }
    TestPKI pki_;
    std::unique_ptr<TarvexSAPServer> server_;
};

TEST_F(InteropTest, ManyRoundsOfSignedRequestsAndResponses) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "9A1F0C2E-0000-4000-8000-000000000001", pki_.setupDER));
    for (uint64_t round = 1; round <= 64; ++round) {
        // Bodies of varied length, the empty one included.
        const Bytes body(static_cast<std::size_t>((round * 37) % 300), static_cast<uint8_t>(round));
        const auto requestSig = device.sign(body);
        ASSERT_TRUE(requestSig.has_value());
        ASSERT_EQ(requestSig->size(), 40u);
        const auto accepted = server_->verifyRequest("9A1F0C2E-0000-4000-8000-000000000001", *requestSig, body);
        ASSERT_EQ(accepted.status, TarvexSAPServerStatus::ok) << "round " << round;
        EXPECT_EQ(accepted.seq, round); // the device counts from 1

        const Bytes answer = bytesOf("{\"round\":" + std::to_string(round) + "}");
        const auto responseSig = server_->signResponse("9A1F0C2E-0000-4000-8000-000000000001", accepted.seq, answer);
        ASSERT_EQ(responseSig.status, TarvexSAPServerStatus::ok);
        EXPECT_EQ(device.verify(Bytes(responseSig.signature.begin(), responseSig.signature.end()), answer),
                  kTarvexSAPOK)
            << "round " << round;
    }
}

TEST_F(InteropTest, CertificateAcceptedAsDERAndAsPEM) {
    const std::string pem = TarvexSAPCertToPEM(pki_.setup.certificate.get());
    for (const Bytes &certificate : {pki_.setupDER, bytesOf(pem)}) {
        Device device;
        ASSERT_TRUE(associate(device, *server_, "SESSION", certificate));
        const Bytes body = bytesOf("payload");
        const auto sig = device.sign(body);
        ASSERT_TRUE(sig.has_value());
        EXPECT_EQ(server_->verifyRequest("SESSION", *sig, body).status, TarvexSAPServerStatus::ok);
    }
}

TEST_F(InteropTest, ResponsesMayArriveInAnyOrder) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
    std::vector<std::pair<uint64_t, Bytes>> pending;
    for (int i = 0; i < 5; ++i) {
        const Bytes body = bytesOf("request " + std::to_string(i));
        const auto sig = device.sign(body);
        ASSERT_TRUE(sig.has_value());
        const auto accepted = server_->verifyRequest("S", *sig, body);
        ASSERT_EQ(accepted.status, TarvexSAPServerStatus::ok);
        pending.emplace_back(accepted.seq, bytesOf("answer " + std::to_string(i)));
    }
    for (auto it = pending.rbegin(); it != pending.rend(); ++it) {
        const auto sig = server_->signResponse("S", it->first, it->second);
        ASSERT_EQ(sig.status, TarvexSAPServerStatus::ok);
        EXPECT_EQ(device.verify(Bytes(sig.signature.begin(), sig.signature.end()), it->second), kTarvexSAPOK);
    }
}

TEST_F(InteropTest, AssociationsOfDifferentSessionsAreIndependent) {
    Device first;
    Device second;
    ASSERT_TRUE(associate(first, *server_, "FIRST", pki_.setupDER));
    ASSERT_TRUE(associate(second, *server_, "SECOND", pki_.setupDER));
    EXPECT_EQ(server_->associationCount(), 2u);

    const Bytes body = bytesOf("same body");
    const auto sigFirst = first.sign(body);
    ASSERT_TRUE(sigFirst.has_value());
    EXPECT_EQ(server_->verifyRequest("SECOND", *sigFirst, body).status, TarvexSAPServerStatus::badSignature);
    EXPECT_EQ(server_->verifyRequest("FIRST", *sigFirst, body).status, TarvexSAPServerStatus::ok);

    // Both devices have seq 1 outstanding; an answer keyed for one is refused by the other.
    const auto sigSecond = second.sign(body);
    ASSERT_TRUE(sigSecond.has_value());
    const auto answerForFirst = server_->signResponse("FIRST", 1, body);
    ASSERT_EQ(answerForFirst.status, TarvexSAPServerStatus::ok);
    const Bytes answer(answerForFirst.signature.begin(), answerForFirst.signature.end());
    EXPECT_EQ(second.verify(answer, body), kTarvexSAPErrorSignatureInvalid);
    EXPECT_EQ(first.verify(answer, body), kTarvexSAPOK);
}

} // namespace
