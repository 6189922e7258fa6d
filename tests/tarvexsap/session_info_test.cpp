// The second exchange: which session infos complete an association, and the exchange's own
// argument and state rules.
#include "tsap_reference.h"

#include <gtest/gtest.h>

#include <cstdlib>

using namespace tsaptest;

namespace {

class SessionInfoTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Info");
        pki_.trust();
        server_ = pki_.server();
    }

    // A device that has sent its handshake request (returned in `request`).
    std::unique_ptr<Device> awaitingInfo(Bytes &request) {
        auto device = std::make_unique<Device>();
        const ExchangeResult r = device->exchange(pki_.setupDER);
        EXPECT_EQ(r.status, kTarvexSAPOK);
        request = r.out;
        return device;
    }

    static Bytes infoBytes(const TarvexSAPServer::HandshakeResult &r) {
        return Bytes(r.sessionInfo.begin(), r.sessionInfo.end());
    }

    TestPKI pki_;
    std::unique_ptr<TarvexSAPServer> server_;
};

TEST_F(SessionInfoTest, SignatureMustComeFromTheCertifiedKey) {
    // Another certificate of the same root, but not the one the device was given.
    const TarvexSAPCredential sibling = TarvexSAPIssueSetupCertificate(pki_.root, "Sibling");
    TarvexSAPServer siblingServer(TarvexSAPCertToDER(sibling.certificate.get()), sibling.key.get());
    Bytes request;
    auto device = awaitingInfo(request);
    const auto answer = siblingServer.handshake("S", request, std::chrono::seconds(60));
    ASSERT_EQ(answer.status, TarvexSAPServerStatus::ok);
    EXPECT_EQ(device->exchange(infoBytes(answer)).status, kTarvexSAPErrorSignatureInvalid);

    // Signed by the root key itself: trusted, but not the setup certificate's key.
    auto second = awaitingInfo(request);
    EXPECT_EQ(second->exchange(tsapref::handServer(request, pki_.root.key.get()).sessionInfo).status,
              kTarvexSAPErrorSignatureInvalid);
}

TEST_F(SessionInfoTest, TamperedOrReplayedInfoIsRefused) {
    Bytes request;
    auto device = awaitingInfo(request);
    const auto answer = server_->handshake("S", request, std::chrono::seconds(60));
    ASSERT_EQ(answer.status, TarvexSAPServerStatus::ok);
    for (std::size_t offset : {1u, 33u, 64u, 65u, 128u}) {
        auto fresh = awaitingInfo(request);
        const auto genuine = server_->handshake("S", request, std::chrono::seconds(60));
        Bytes altered = infoBytes(genuine);
        altered[offset] ^= 0x40;
        EXPECT_EQ(fresh->exchange(altered).status, kTarvexSAPErrorSignatureInvalid) << "offset " << offset;
    }
    // An info answering another device's request does not fit this transcript.
    Bytes otherRequest;
    auto other = awaitingInfo(otherRequest);
    EXPECT_EQ(other->exchange(infoBytes(answer)).status, kTarvexSAPErrorSignatureInvalid);
    EXPECT_EQ(device->exchange(infoBytes(answer)).status, kTarvexSAPOK);
}

TEST_F(SessionInfoTest, VersionOtherThanOneIsMalformedEvenWhenSigned) {
    for (uint8_t version : {0, 2, 255}) {
        Bytes request;
        auto device = awaitingInfo(request);
        const auto info = tsapref::handServer(request, pki_.setup.key.get(), version).sessionInfo;
        EXPECT_EQ(device->exchange(info).status, kTarvexSAPErrorMalformedMessage) << int(version);
    }
}

TEST_F(SessionInfoTest, LowOrderServerKeyIsRefusedEvenWhenSigned) {
    // u = 0 and u = 1 are small-order points: the shared secret would be all zero.
    Bytes zero(32, 0);
    Bytes one(32, 0);
    one[0] = 1;
    for (const Bytes *point : {&zero, &one}) {
        Bytes request;
        auto device = awaitingInfo(request);
        const auto info = tsapref::handServer(request, pki_.setup.key.get(), 1, point).sessionInfo;
        EXPECT_EQ(device->exchange(info).status, kTarvexSAPErrorMalformedMessage);
        EXPECT_FALSE(device->sign(bytesOf("x")).has_value());
    }
}

TEST_F(SessionInfoTest, WrongLengthIsMalformed) {
    for (std::size_t length : {0u, 1u, 128u, 130u, 258u}) {
        Bytes request;
        auto device = awaitingInfo(request);
        Bytes info = infoBytes(server_->handshake("S", request, std::chrono::seconds(60)));
        info.resize(length, 0);
        EXPECT_EQ(device->exchange(info).status, kTarvexSAPErrorMalformedMessage) << length;
    }
}

TEST_F(SessionInfoTest, FailedInfoLeavesNoUsableAssociation) {
    Bytes request;
    auto device = awaitingInfo(request);
    Bytes info = infoBytes(server_->handshake("S", request, std::chrono::seconds(60)));
    Bytes bad = info;
    bad[100] ^= 1;
    ASSERT_EQ(device->exchange(bad).status, kTarvexSAPErrorSignatureInvalid);
    int32_t status = 0;
    EXPECT_FALSE(device->sign(bytesOf("x"), &status).has_value());
    EXPECT_EQ(status, kTarvexSAPErrorWrongState);
    // The genuine info arriving late does not revive it.
    EXPECT_EQ(device->exchange(info).status, kTarvexSAPErrorWrongState);
}

TEST_F(SessionInfoTest, ExchangeOutOfTurnIsWrongStateAndHarmless) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
    EXPECT_EQ(device.exchange(pki_.setupDER).status, kTarvexSAPErrorWrongState);
    EXPECT_EQ(device.exchange(Bytes(129, 1)).status, kTarvexSAPErrorWrongState);
    const Bytes body = bytesOf("still associated");
    const auto sig = device.sign(body);
    ASSERT_TRUE(sig.has_value());
    EXPECT_EQ(server_->verifyRequest("S", *sig, body).status, TarvexSAPServerStatus::ok);
}

TEST_F(SessionInfoTest, SelectorAndArgumentsAreCheckedBeforeState) {
    Device device;
    for (int32_t selector : {0, 199, 201, -200}) {
        const ExchangeResult r = device.exchange(pki_.setupDER, selector);
        EXPECT_EQ(r.status, kTarvexSAPErrorBadArgument) << selector;
        EXPECT_FALSE(r.outReturned);
        EXPECT_EQ(r.returnCode, 255) << "return code written on failure";
    }
    uint8_t *out = nullptr;
    uint32_t outLen = 0;
    uint8_t code = 255;
    const Bytes &cert = pki_.setupDER;
    QVSAPContextOpaque_ *h = device.handle();
    TarvexHWInfo_ &hw = device.hwInfo();
    EXPECT_EQ(TarvexSAPExchange(200, nullptr, h, cert.data(), cert.size(), &out, &outLen, &code),
              kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPExchange(200, &hw, h, nullptr, cert.size(), &out, &outLen, &code), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPExchange(200, &hw, h, cert.data(), cert.size(), nullptr, &outLen, &code),
              kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPExchange(200, &hw, h, cert.data(), cert.size(), &out, nullptr, &code),
              kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPExchange(200, &hw, h, cert.data(), cert.size(), &out, &outLen, nullptr),
              kTarvexSAPErrorBadArgument);
    EXPECT_EQ(out, nullptr);
    // None of that consumed the context's turn.
    EXPECT_TRUE(associate(device, *server_, "S", pki_.setupDER));
}

} // namespace
