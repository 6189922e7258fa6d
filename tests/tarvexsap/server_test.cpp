// TarvexSAPServer on its own, driven by the hand-written device: request checks, the replay
// window through the public interface, replacement, expiry with an injected clock, set-up.
#include "tsap_reference.h"

#include <gtest/gtest.h>

#include <stdexcept>

using namespace tsaptest;
using std::chrono::seconds;

namespace {

class ServerTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Server");
        server_ = pki_.server(clock_.function());
    }

    // Handshakes by hand under `id` and returns the keys.
    tsapref::Keys open(const std::string &id, seconds ttl = seconds(600)) {
        const auto device = tsapref::handDeviceRequest(bytesOf("hw"));
        const auto answer = server_->handshake(id, device.request, ttl);
        EXPECT_EQ(answer.status, TarvexSAPServerStatus::ok);
        tsapref::Keys keys;
        EXPECT_TRUE(tsapref::handDeviceFinish(device, Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end()),
                                              pki_.setup.certificate.get(), keys));
        return keys;
    }

    TarvexSAPServerStatus submit(const std::string &id, const tsapref::Keys &keys, uint64_t seq) {
        const Bytes body = bytesOf("body " + std::to_string(seq));
        const auto r = server_->verifyRequest(id, tsapref::messageSignature(keys.request, "TSAP1 req", seq, body), body);
        if (r.status == TarvexSAPServerStatus::ok) {
            EXPECT_EQ(r.seq, seq);
        }
        return r.status;
    }

    ManualClock clock_;
    TestPKI pki_;
    std::unique_ptr<TarvexSAPServer> server_;
};

TEST_F(ServerTest, MalformedHandshakeRequests) {
    const Bytes good = tsapref::handDeviceRequest(bytesOf("0123456789abcdefghij")).request; // n = 20
    ASSERT_EQ(server_->handshake("S", good, seconds(60)).status, TarvexSAPServerStatus::ok);

    auto expectMalformed = [&](Bytes request, const char *what) {
        EXPECT_EQ(server_->handshake("S", request, seconds(60)).status, TarvexSAPServerStatus::malformed) << what;
    };
    expectMalformed({}, "empty");
    expectMalformed(Bytes(good.begin(), good.end() - 1), "89 bytes");
    Bytes longer = good;
    longer.push_back(0);
    expectMalformed(longer, "91 bytes");
    Bytes magic = good;
    magic[0] = 'X';
    expectMalformed(magic, "magic");
    for (uint8_t version : {0, 2}) {
        Bytes v = good;
        v[4] = version;
        expectMalformed(v, "version");
    }
    Bytes tooLong = good;
    tooLong[5] = 21;
    expectMalformed(tooLong, "n = 21");

    Bytes padded = tsapref::handDeviceRequest(bytesOf("abc")).request;
    ASSERT_EQ(server_->handshake("S", padded, seconds(60)).status, TarvexSAPServerStatus::ok);
    padded[25] = 1; // last padding byte
    expectMalformed(padded, "non-zero padding");

    Bytes lowOrder = good;
    std::fill(lowOrder.begin() + 26, lowOrder.begin() + 58, 0);
    expectMalformed(lowOrder, "all-zero client key");

    EXPECT_EQ(server_->handshake("", good, seconds(60)).status, TarvexSAPServerStatus::malformed);
    EXPECT_EQ(server_->handshake(std::string(TarvexSAPServer::kMaxSessionIdentifierLength + 1, 'A'), good,
                                 seconds(60))
                  .status,
              TarvexSAPServerStatus::malformed);
    EXPECT_EQ(server_->associationCount(), 1u); // only the good ones, both under "S"
}

TEST_F(ServerTest, ReplayWindowEdges) {
    const auto keys = open("S");
    EXPECT_EQ(submit("S", keys, 0), TarvexSAPServerStatus::replay); // authentic, but 0 is never valid
    EXPECT_EQ(submit("S", keys, 5), TarvexSAPServerStatus::ok);
    EXPECT_EQ(submit("S", keys, 5), TarvexSAPServerStatus::replay);
    EXPECT_EQ(submit("S", keys, 3), TarvexSAPServerStatus::ok); // inside the window, once
    EXPECT_EQ(submit("S", keys, 3), TarvexSAPServerStatus::replay);

    EXPECT_EQ(submit("S", keys, 5000), TarvexSAPServerStatus::ok); // jump ahead
    EXPECT_EQ(submit("S", keys, 5000 - 1023), TarvexSAPServerStatus::ok); // lowest in the window
    EXPECT_EQ(submit("S", keys, 5000 - 1024), TarvexSAPServerStatus::replay); // just below
    EXPECT_EQ(submit("S", keys, 3), TarvexSAPServerStatus::replay);
    EXPECT_EQ(submit("S", keys, 4999), TarvexSAPServerStatus::ok);
    EXPECT_EQ(submit("S", keys, 4999), TarvexSAPServerStatus::replay);
    EXPECT_EQ(submit("S", keys, 5001), TarvexSAPServerStatus::ok);
    EXPECT_EQ(submit("S", keys, 5000 - 1023), TarvexSAPServerStatus::replay); // now below
}

TEST_F(ServerTest, ForgedSignatureDoesNotMoveTheWindow) {
    const auto keys = open("S");
    const Bytes body = bytesOf("body");
    Bytes forged = tsapref::messageSignature(keys.request, "TSAP1 req", 1000000, body);
    forged[39] ^= 1;
    EXPECT_EQ(server_->verifyRequest("S", forged, body).status, TarvexSAPServerStatus::badSignature);
    EXPECT_EQ(submit("S", keys, 1), TarvexSAPServerStatus::ok);
}

TEST_F(ServerTest, NewHandshakeReplacesTheAssociation) {
    const auto oldKeys = open("S");
    EXPECT_EQ(submit("S", oldKeys, 1), TarvexSAPServerStatus::ok);
    const auto newKeys = open("S");
    EXPECT_EQ(server_->associationCount(), 1u);
    EXPECT_EQ(submit("S", oldKeys, 2), TarvexSAPServerStatus::badSignature);
    // A fresh replay window comes with it.
    EXPECT_EQ(submit("S", newKeys, 1), TarvexSAPServerStatus::ok);
}

TEST_F(ServerTest, UnknownSession) {
    const auto keys = open("S");
    EXPECT_EQ(submit("T", keys, 1), TarvexSAPServerStatus::unknownSession);
    EXPECT_EQ(server_->signResponse("T", 1, {}).status, TarvexSAPServerStatus::unknownSession);
}

TEST_F(ServerTest, ExpiryFollowsTheInjectedClock) {
    const auto keys = open("S", seconds(60));
    const auto longLived = open("L", seconds(3600));
    clock_.advance(seconds(59));
    EXPECT_EQ(submit("S", keys, 1), TarvexSAPServerStatus::ok);
    EXPECT_EQ(server_->signResponse("S", 1, {}).status, TarvexSAPServerStatus::ok);
    clock_.advance(seconds(1));
    EXPECT_EQ(submit("S", keys, 2), TarvexSAPServerStatus::expired);
    EXPECT_EQ(server_->signResponse("S", 1, {}).status, TarvexSAPServerStatus::expired);
    EXPECT_EQ(submit("L", longLived, 1), TarvexSAPServerStatus::ok);

    EXPECT_EQ(server_->dropExpired(), 1u);
    EXPECT_EQ(server_->associationCount(), 1u);
    EXPECT_EQ(submit("S", keys, 3), TarvexSAPServerStatus::unknownSession);
    EXPECT_EQ(server_->dropExpired(), 0u);

    // A handshake renews an identifier whatever the state of the old association.
    const auto renewed = open("S", seconds(60));
    EXPECT_EQ(submit("S", renewed, 1), TarvexSAPServerStatus::ok);
    const auto instant = open("Z", seconds(0));
    EXPECT_EQ(submit("Z", instant, 1), TarvexSAPServerStatus::expired);
}

TEST_F(ServerTest, HandshakesSweepExpiredAssociations) {
    const Bytes request = tsapref::handDeviceRequest({}).request;
    for (int i = 0; i < 1000; ++i) {
        ASSERT_EQ(server_->handshake("OLD-" + std::to_string(i), request, seconds(60)).status,
                  TarvexSAPServerStatus::ok);
    }
    clock_.advance(seconds(61));
    for (int i = 0; i < 24; ++i) { // the 1024th entry triggers the sweep
        ASSERT_EQ(server_->handshake("NEW-" + std::to_string(i), request, seconds(60)).status,
                  TarvexSAPServerStatus::ok);
    }
    EXPECT_EQ(server_->associationCount(), 24u);
    const auto keys = open("NEW-23");
    EXPECT_EQ(submit("NEW-23", keys, 1), TarvexSAPServerStatus::ok);
    EXPECT_EQ(server_->signResponse("OLD-0", 1, {}).status, TarvexSAPServerStatus::unknownSession);
}

TEST(ServerSetupTest, KeyMustMatchTheCertificate) {
    const TestPKI pki = TestPKI::make("Setup");
    const TarvexSAPKey other = TarvexSAPGenerateEd25519Key();
    TarvexSAPKey ec(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, other.get()), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, ec.get()), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, static_cast<EVP_PKEY *>(nullptr)), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(Bytes(pki.setupDER.begin(), pki.setupDER.end() - 1), pki.setup.key.get()),
                 std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, std::string_view("not a key")), std::invalid_argument);

    // From PEM, the server works and serves the certificate it was given.
    TarvexSAPServer fromPEM(pki.setupDER, TarvexSAPKeyToPEM(pki.setup.key.get()));
    EXPECT_EQ(fromPEM.setupCertificateDER(), pki.setupDER);
    const auto device = tsapref::handDeviceRequest({});
    const auto answer = fromPEM.handshake("S", device.request, seconds(60));
    ASSERT_EQ(answer.status, TarvexSAPServerStatus::ok);
    tsapref::Keys keys;
    EXPECT_TRUE(tsapref::handDeviceFinish(device, Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end()),
                                          pki.setup.certificate.get(), keys));
}

} // namespace
