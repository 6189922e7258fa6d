// Request signing and response verification on the device, with the server as counterpart:
// tampering, replay, cross-direction use, lengths, state, and the outstanding-seq bound.
#include "tsap_test_support.h"

#include <gtest/gtest.h>

#include <cstdlib>

using namespace tsaptest;

namespace {

class MessageSignatureTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Messages");
        pki_.trust();
        server_ = pki_.server();
        device_ = std::make_unique<Device>();
        ASSERT_TRUE(associate(*device_, *server_, kSession, pki_.setupDER));
    }

    Bytes response(uint64_t seq, const Bytes &body) {
        const auto r = server_->signResponse(kSession, seq, body);
        EXPECT_EQ(r.status, TarvexSAPServerStatus::ok);
        return Bytes(r.signature.begin(), r.signature.end());
    }

    static constexpr const char *kSession = "6F1B7E9A-3C2D-4E5F-8A9B-0C1D2E3F4A5B";
    TestPKI pki_;
    std::unique_ptr<TarvexSAPServer> server_;
    std::unique_ptr<Device> device_;
};

TEST_F(MessageSignatureTest, TamperedRequestIsRefusedByTheServer) {
    const Bytes body = bytesOf("{\"uuid\":\"x\",\"token\":\"AAEC\"}");
    const auto sig = device_->sign(body);
    ASSERT_TRUE(sig.has_value());

    Bytes otherBody = body;
    otherBody.back() ^= 1;
    EXPECT_EQ(server_->verifyRequest(kSession, *sig, otherBody).status, TarvexSAPServerStatus::badSignature);
    Bytes longer = body;
    longer.push_back(0);
    EXPECT_EQ(server_->verifyRequest(kSession, *sig, longer).status, TarvexSAPServerStatus::badSignature);
    for (std::size_t offset : {0u, 7u, 8u, 39u}) { // seq bytes and MAC bytes
        Bytes bad = *sig;
        bad[offset] ^= 0x80;
        EXPECT_EQ(server_->verifyRequest(kSession, bad, body).status, TarvexSAPServerStatus::badSignature)
            << offset;
    }
    Bytes shortSig(sig->begin(), sig->end() - 1);
    EXPECT_EQ(server_->verifyRequest(kSession, shortSig, body).status, TarvexSAPServerStatus::badSignature);
    EXPECT_EQ(server_->verifyRequest(kSession, *sig, body).status, TarvexSAPServerStatus::ok);
}

TEST_F(MessageSignatureTest, TamperedResponseIsRefusedByTheDevice) {
    const Bytes request = bytesOf("request");
    ASSERT_TRUE(device_->sign(request).has_value());
    const Bytes body = bytesOf("{\"plan\":\"default\"}");
    const Bytes good = response(1, body);

    Bytes otherBody = body;
    otherBody[0] ^= 1;
    EXPECT_EQ(device_->verify(good, otherBody), kTarvexSAPErrorSignatureInvalid);
    for (std::size_t offset : {0u, 7u, 8u, 39u}) {
        Bytes bad = good;
        bad[offset] ^= 0x01;
        EXPECT_EQ(device_->verify(bad, body), kTarvexSAPErrorSignatureInvalid) << offset;
    }
    // Failed attempts do not use up the outstanding seq.
    EXPECT_EQ(device_->verify(good, body), kTarvexSAPOK);
}

TEST_F(MessageSignatureTest, ResponseIsSingleUse) {
    ASSERT_TRUE(device_->sign(bytesOf("a")).has_value());
    ASSERT_TRUE(device_->sign(bytesOf("b")).has_value());
    const Bytes body = bytesOf("answer");
    const Bytes first = response(1, body);
    EXPECT_EQ(device_->verify(first, body), kTarvexSAPOK);
    EXPECT_EQ(device_->verify(first, body), kTarvexSAPErrorSignatureInvalid);
    // A seq that was never issued cannot be answered.
    EXPECT_EQ(device_->verify(response(3, body), body), kTarvexSAPErrorSignatureInvalid);
    EXPECT_EQ(device_->verify(response(2, body), body), kTarvexSAPOK);
}

TEST_F(MessageSignatureTest, RequestSignatureNeverPassesAsResponse) {
    const Bytes body = bytesOf("echoed body");
    const auto requestSig = device_->sign(body);
    ASSERT_TRUE(requestSig.has_value());
    // seq 1 is outstanding, so only the key and label stand in the way.
    EXPECT_EQ(device_->verify(*requestSig, body), kTarvexSAPErrorSignatureInvalid);
    // Nor the other way round.
    EXPECT_EQ(server_->verifyRequest(kSession, response(1, body), body).status, TarvexSAPServerStatus::badSignature);
}

TEST_F(MessageSignatureTest, SignatureLengthMustBeForty) {
    ASSERT_TRUE(device_->sign(bytesOf("r")).has_value());
    const Bytes body = bytesOf("answer");
    const Bytes good = response(1, body);
    Bytes longer = good;
    longer.push_back(0);
    EXPECT_EQ(device_->verify(Bytes(good.begin(), good.end() - 1), body), kTarvexSAPErrorMalformedMessage);
    EXPECT_EQ(device_->verify(longer, body), kTarvexSAPErrorMalformedMessage);
    EXPECT_EQ(device_->verify({}, body), kTarvexSAPErrorMalformedMessage);
    EXPECT_EQ(device_->verify(good, body), kTarvexSAPOK);
}

TEST_F(MessageSignatureTest, EmptyBodiesAndNullPointers) {
    uint8_t *sig = nullptr;
    uint32_t sigLen = 0;
    ASSERT_EQ(TarvexSAPSign(device_->handle(), nullptr, 0, &sig, &sigLen), kTarvexSAPOK);
    ASSERT_NE(sig, nullptr);
    ASSERT_EQ(sigLen, 40u);
    EXPECT_EQ(server_->verifyRequest(kSession, Bytes(sig, sig + sigLen), {}).status, TarvexSAPServerStatus::ok);
    std::free(sig);
    const Bytes answer = response(1, {});
    EXPECT_EQ(TarvexSAPVerify(device_->handle(), answer.data(), answer.size(), nullptr, 0), kTarvexSAPOK);

    uint8_t byte = 0;
    EXPECT_EQ(TarvexSAPSign(device_->handle(), nullptr, 1, &sig, &sigLen), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPSign(device_->handle(), &byte, 1, nullptr, &sigLen), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPSign(device_->handle(), &byte, 1, &sig, nullptr), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPVerify(device_->handle(), nullptr, 40, &byte, 1), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPVerify(device_->handle(), answer.data(), answer.size(), nullptr, 1),
              kTarvexSAPErrorBadArgument);
}

TEST_F(MessageSignatureTest, OutstandingSeqsAreBoundedDroppingTheLowest) {
    const Bytes body = bytesOf("r");
    for (int i = 0; i < 1025; ++i) {
        ASSERT_TRUE(device_->sign(body).has_value());
    }
    const Bytes answer = bytesOf("a");
    EXPECT_EQ(device_->verify(response(1, answer), answer), kTarvexSAPErrorSignatureInvalid);
    EXPECT_EQ(device_->verify(response(2, answer), answer), kTarvexSAPOK);
    EXPECT_EQ(device_->verify(response(1025, answer), answer), kTarvexSAPOK);
    // Answering frees room: after two answers, two more signatures drop nothing.
    ASSERT_TRUE(device_->sign(body).has_value());
    ASSERT_TRUE(device_->sign(body).has_value());
    EXPECT_EQ(device_->verify(response(3, answer), answer), kTarvexSAPOK);
    EXPECT_EQ(device_->verify(response(1027, answer), answer), kTarvexSAPOK);
}

TEST(MessageSignatureStateTest, SignAndVerifyNeedAnAssociation) {
    const TestPKI pki = TestPKI::make("State");
    pki.trust();
    Device device;
    int32_t status = 0;
    const Bytes sig(40, 1);
    EXPECT_FALSE(device.sign(bytesOf("x"), &status).has_value());
    EXPECT_EQ(status, kTarvexSAPErrorWrongState);
    EXPECT_EQ(device.verify(sig, bytesOf("x")), kTarvexSAPErrorWrongState);
    ASSERT_EQ(device.exchange(pki.setupDER).status, kTarvexSAPOK);
    EXPECT_FALSE(device.sign(bytesOf("x"), &status).has_value());
    EXPECT_EQ(status, kTarvexSAPErrorWrongState);
    EXPECT_EQ(device.verify(sig, bytesOf("x")), kTarvexSAPErrorWrongState);
}

} // namespace
