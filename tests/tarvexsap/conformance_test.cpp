// Each side against a hand-written rendering of the wire layout, so that a shared mistake of
// device and server (a label, an offset, a key split) cannot hide behind their agreement.
#include "tsap_reference.h"

#include <gtest/gtest.h>

using namespace tsaptest;

namespace {

class ConformanceTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Conformance");
        pki_.trust();
    }
    TestPKI pki_;
};

TEST_F(ConformanceTest, DeviceHandshakeRequestLayout) {
    TarvexHWInfo_ hw{};
    hw.IDLength = 7;
    for (uint8_t i = 0; i < 20; ++i) {
        hw.ID[i] = static_cast<uint8_t>(0xA0 + i); // bytes past IDLength must not leak out
    }
    Device a(hw);
    Device b(hw);
    const ExchangeResult ra = a.exchange(pki_.setupDER);
    const ExchangeResult rb = b.exchange(pki_.setupDER);
    ASSERT_EQ(ra.status, kTarvexSAPOK);
    ASSERT_EQ(ra.returnCode, 1);
    ASSERT_EQ(ra.out.size(), 90u);
    EXPECT_EQ(Bytes(ra.out.begin(), ra.out.begin() + 4), bytesOf("TSAP"));
    EXPECT_EQ(ra.out[4], 1);
    EXPECT_EQ(ra.out[5], 7);
    EXPECT_EQ(Bytes(ra.out.begin() + 6, ra.out.begin() + 13), Bytes(hw.ID, hw.ID + 7));
    EXPECT_EQ(Bytes(ra.out.begin() + 13, ra.out.begin() + 26), Bytes(13, 0));
    // Fresh ephemeral key and nonce for every context.
    ASSERT_EQ(rb.out.size(), 90u);
    EXPECT_NE(Bytes(ra.out.begin() + 26, ra.out.begin() + 58), Bytes(rb.out.begin() + 26, rb.out.begin() + 58));
    EXPECT_NE(Bytes(ra.out.begin() + 58, ra.out.end()), Bytes(rb.out.begin() + 58, rb.out.end()));
}

TEST_F(ConformanceTest, DeviceAgainstHandWrittenServer) {
    Device device;
    const ExchangeResult request = device.exchange(pki_.setupDER);
    ASSERT_EQ(request.status, kTarvexSAPOK);
    const auto server = tsapref::handServer(request.out, pki_.setup.key.get());
    const ExchangeResult done = device.exchange(server.sessionInfo);
    ASSERT_EQ(done.status, kTarvexSAPOK);
    EXPECT_EQ(done.returnCode, 0);
    EXPECT_FALSE(done.outReturned);

    const Bytes body = bytesOf("{\"token\":\"abc\"}");
    for (uint64_t seq = 1; seq <= 3; ++seq) {
        const auto sig = device.sign(body);
        ASSERT_TRUE(sig.has_value());
        EXPECT_EQ(*sig, tsapref::messageSignature(server.keys.request, "TSAP1 req", seq, body));
    }
    const Bytes answer = bytesOf("answer");
    // Keyed with the request key, or labelled as a request: both must fail as responses.
    EXPECT_EQ(device.verify(tsapref::messageSignature(server.keys.request, "TSAP1 rsp", 2, answer), answer),
              kTarvexSAPErrorSignatureInvalid);
    EXPECT_EQ(device.verify(tsapref::messageSignature(server.keys.response, "TSAP1 req", 2, answer), answer),
              kTarvexSAPErrorSignatureInvalid);
    EXPECT_EQ(device.verify(tsapref::messageSignature(server.keys.response, "TSAP1 rsp", 2, answer), answer),
              kTarvexSAPOK);
}

TEST_F(ConformanceTest, ServerAgainstHandWrittenDevice) {
    auto server = pki_.server();
    const auto device = tsapref::handDeviceRequest(bytesOf("hw-1234"));
    const auto answer = server->handshake("HAND", device.request, std::chrono::seconds(600));
    ASSERT_EQ(answer.status, TarvexSAPServerStatus::ok);
    tsapref::Keys keys;
    ASSERT_TRUE(tsapref::handDeviceFinish(device, Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end()),
                                          pki_.setup.certificate.get(), keys));

    const Bytes body = bytesOf("request body");
    const auto accepted =
        server->verifyRequest("HAND", tsapref::messageSignature(keys.request, "TSAP1 req", 41, body), body);
    ASSERT_EQ(accepted.status, TarvexSAPServerStatus::ok);
    EXPECT_EQ(accepted.seq, 41u);
    // A request signed with the response key must not pass.
    EXPECT_EQ(server->verifyRequest("HAND", tsapref::messageSignature(keys.response, "TSAP1 req", 42, body), body)
                  .status,
              TarvexSAPServerStatus::badSignature);

    const Bytes reply = bytesOf("response body");
    const auto sig = server->signResponse("HAND", 41, reply);
    ASSERT_EQ(sig.status, TarvexSAPServerStatus::ok);
    EXPECT_EQ(Bytes(sig.signature.begin(), sig.signature.end()),
              tsapref::messageSignature(keys.response, "TSAP1 rsp", 41, reply));
}

} // namespace
