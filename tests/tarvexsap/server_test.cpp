// TarvexSAPServer, and device and server together once associated: which handshake requests are
// answered, signed requests and responses round trip while every altered or misdirected
// signature is refused on either side, each request passes the replay window once and each
// response is taken once, associations are replaced, expire and are swept. Also the server's
// set-up and the certificate tooling's refusals.
#include "tsap_test_support.h"

#include <gtest/gtest.h>

#include <openssl/x509v3.h>

#include <stdexcept>

using namespace tsaptest;
using Status = TarvexSAPServerStatus;
using std::chrono::seconds;

namespace {

constexpr int32_t INVALID = kTarvexSAPErrorSignatureInvalid;

class ServerTest : public TsapTest {
protected:
    // The server's signature of the response to `seq`.
    Bytes response(uint64_t seq, const Bytes &body, const char *session = "S") {
        const auto r = server_->signResponse(session, seq, body);
        EXPECT_EQ(r.status, Status::ok);
        return Bytes(r.signature.begin(), r.signature.end());
    }
    Status submit(Device &device, const char *session) {
        Bytes signature;
        EXPECT_EQ(device.sign(bytesOf(session), &signature), kTarvexSAPOK);
        return server_->verifyRequest(session, signature, bytesOf(session)).status;
    }
};

const struct {
    const char *name;
    void (*apply)(Bytes &request);
} kMalformedRequests[] = {
    // clang-format off
    {"89 bytes", [](Bytes &r) { r.pop_back(); }},
    {"91 bytes", [](Bytes &r) { r.push_back(0); }},
    {"magic", [](Bytes &r) { r[3] = 'X'; }},
    {"version 0", [](Bytes &r) { r[4] = 0; }},
    {"version 2", [](Bytes &r) { r[4] = 2; }},
    {"identifier of 21", [](Bytes &r) { r[5] = 21; }},
    {"padding not zero", [](Bytes &r) { r[5] = 19; }},  // the 20th identifier byte becomes padding
    {"all-zero client key", [](Bytes &r) { std::fill_n(r.begin() + 26, 32, 0); }},  // low order
    // clang-format on
};

TEST_F(ServerTest, AnswersOnlyWellFormedRequestsUnderAnAcceptableIdentifier) {
    TarvexHWInfo_ hw{20, {}};
    std::fill_n(hw.ID, 20, 0x41);
    Device device(hw), shortID(TarvexHWInfo_{3, {1, 2, 3}});
    const Bytes good = device.exchange(pki_.setupDER).out;
    ASSERT_EQ(server_->handshake("S", shortID.exchange(pki_.setupDER).out, seconds(60)).status, Status::ok);
    for (const auto &fault : kMalformedRequests) {
        Bytes bad = good;
        fault.apply(bad);
        EXPECT_EQ(server_->handshake("T", bad, seconds(60)).status, Status::malformed) << fault.name;
    }
    const std::string longest(TarvexSAPServer::kMaxSessionIdentifierLength, 'A');
    EXPECT_EQ(server_->handshake("", good, seconds(60)).status, Status::malformed);
    EXPECT_EQ(server_->handshake(longest + "A", good, seconds(60)).status, Status::malformed);
    EXPECT_EQ(server_->handshake(longest, good, seconds(60)).status, Status::ok);
    EXPECT_EQ(server_->associationCount(), 2u);
}

TEST_F(ServerTest, RequestsAndResponsesRoundTripInAnyOrder) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
    const Bytes bodies[] = {bytesOf("{\"token\":\"AAEC\"}"), {}, Bytes(300, 7)};
    for (uint64_t seq = 1; seq <= 3; ++seq) {
        Bytes signature;
        ASSERT_EQ(device.sign(bodies[seq - 1], &signature), kTarvexSAPOK);
        const auto accepted = server_->verifyRequest("S", signature, bodies[seq - 1]);
        EXPECT_TRUE(accepted.status == Status::ok && accepted.seq == seq); // the device counts from 1
    }
    for (uint64_t seq = 3; seq >= 1; --seq) {
        EXPECT_EQ(device.verify(response(seq, bodies[seq - 1]), bodies[seq - 1]), kTarvexSAPOK) << seq;
    }
}

const struct {
    const char *name;
    void (*apply)(Bytes &signature, Bytes &body);
    int32_t deviceStatus; // the server says badSignature to all
} kFaults[] = {
    // clang-format off
    {"body altered", [](Bytes &, Bytes &b) { b[0] ^= 0x01; }, INVALID},
    {"body longer", [](Bytes &, Bytes &b) { b.push_back(0); }, INVALID},
    {"first seq byte", [](Bytes &s, Bytes &) { s[0] ^= 0x80; }, INVALID},
    {"last seq byte", [](Bytes &s, Bytes &) { s[7] ^= 0x01; }, INVALID},
    {"first MAC byte", [](Bytes &s, Bytes &) { s[8] ^= 0x01; }, INVALID},
    {"last MAC byte", [](Bytes &s, Bytes &) { s[39] ^= 0x80; }, INVALID},
    {"39 bytes", [](Bytes &s, Bytes &) { s.pop_back(); }, kTarvexSAPErrorMalformedMessage},
    {"41 bytes", [](Bytes &s, Bytes &) { s.push_back(0); }, kTarvexSAPErrorMalformedMessage},
    // clang-format on
};

TEST_F(ServerTest, AlteredSignaturesAreRefusedAndUseNothingUp) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
    for (const auto &fault : kFaults) {
        SCOPED_TRACE(fault.name);
        const Bytes body = bytesOf("body");
        Bytes signature, alteredBody = body;
        ASSERT_EQ(device.sign(body, &signature), kTarvexSAPOK);
        Bytes altered = signature;
        fault.apply(altered, alteredBody);
        EXPECT_EQ(server_->verifyRequest("S", altered, alteredBody).status, Status::badSignature);
        const auto accepted = server_->verifyRequest("S", signature, body);
        ASSERT_EQ(accepted.status, Status::ok);
        const Bytes answer = response(accepted.seq, body);
        altered = answer;
        alteredBody = body;
        fault.apply(altered, alteredBody);
        EXPECT_EQ(device.verify(altered, alteredBody), fault.deviceStatus);
        EXPECT_EQ(device.verify(answer, body), kTarvexSAPOK);
    }
}

TEST_F(ServerTest, EachRequestPassesOnceAndEachOutstandingRequestIsAnsweredOnce) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
    const Bytes body = bytesOf("body");
    Bytes first, second;
    ASSERT_EQ(device.sign(body, &first), kTarvexSAPOK);
    ASSERT_EQ(device.sign(body, &second), kTarvexSAPOK);
    // A forged seq far ahead must not move the window: only an authentic signature may.
    EXPECT_EQ(server_->verifyRequest("S", Bytes{0x7F} + Bytes(second.begin() + 1, second.end()), body).status,
              Status::badSignature);
    EXPECT_EQ(server_->verifyRequest("S", second, body).status, Status::ok);
    EXPECT_EQ(server_->verifyRequest("S", second, body).status, Status::replay);
    EXPECT_EQ(server_->verifyRequest("S", first, body).status, Status::ok); // late, inside the window
    EXPECT_EQ(server_->verifyRequest("S", first, body).status, Status::replay);

    // seq 1 is outstanding, so only the key and label tell a request from a response.
    EXPECT_EQ(device.verify(first, body), INVALID);
    EXPECT_EQ(server_->verifyRequest("S", response(3, body), body).status, Status::badSignature);
    EXPECT_EQ(device.verify(response(3, body), body), INVALID); // never issued
    EXPECT_EQ(device.verify(response(1, body), body), kTarvexSAPOK);
    EXPECT_EQ(device.verify(response(1, body), body), INVALID); // answered
    EXPECT_EQ(device.verify(response(2, body), body), kTarvexSAPOK);
    // At most 1024 are outstanding; when full, the lowest is dropped. Now 3..1027 are issued.
    for (int i = 0; i < 1025; ++i) ASSERT_EQ(device.sign(body), kTarvexSAPOK);
    EXPECT_EQ(device.verify(response(3, body), body), INVALID);
    EXPECT_EQ(device.verify(response(4, body), body), kTarvexSAPOK);
    // An answer makes room: one more signature drops nothing.
    ASSERT_EQ(device.sign(body), kTarvexSAPOK);
    EXPECT_EQ(device.verify(response(5, body), body), kTarvexSAPOK);
    EXPECT_EQ(device.verify(response(1028, body), body), kTarvexSAPOK);
}

TEST_F(ServerTest, AssociationsAreReplacedExpireAndAreSwept) {
    Device old, renewed, other;
    ASSERT_TRUE(associate(old, *server_, "S", pki_.setupDER));
    ASSERT_TRUE(associate(renewed, *server_, "S", pki_.setupDER)); // replaces, with a fresh window
    ASSERT_TRUE(associate(other, *server_, "L", pki_.setupDER));
    EXPECT_EQ(submit(old, "S"), Status::badSignature);
    EXPECT_EQ(submit(renewed, "S"), Status::ok);
    EXPECT_EQ(submit(renewed, "L"), Status::badSignature); // another session's keys
    EXPECT_EQ(submit(renewed, "T"), Status::unknownSession);
    EXPECT_EQ(server_->signResponse("T", 1, {}).status, Status::unknownSession);

    // associate() asks for an hour; expired from the instant it is reached.
    const Bytes request = Device().exchange(pki_.setupDER).out;
    ASSERT_EQ(server_->handshake("Z", request, seconds(0)).status, Status::ok);
    EXPECT_EQ(server_->signResponse("Z", 1, {}).status, Status::expired);
    *now_ += seconds(3599);
    EXPECT_EQ(submit(renewed, "S"), Status::ok);
    *now_ += seconds(1);
    EXPECT_EQ(submit(renewed, "S"), Status::expired);
    EXPECT_EQ(server_->signResponse("S", 2, {}).status, Status::expired);
    EXPECT_EQ(server_->dropExpired(), 3u); // S, L and Z
    EXPECT_EQ(server_->dropExpired(), 0u);

    // Handshakes under ever new identifiers sweep the expired ones once the table reaches 1024.
    for (int i = 0; i < 1024; ++i) {
        if (i == 1000) *now_ += seconds(60);
        ASSERT_EQ(server_->handshake("ID-" + std::to_string(i), request, seconds(60)).status, Status::ok);
    }
    EXPECT_EQ(server_->associationCount(), 24u);
}

TEST(ServerSetupTest, KeyMustBeTheCertificatesEd25519Key) {
    const TestPKI pki("Setup");
    const TarvexSAPKey other = TarvexSAPGenerateEd25519Key();
    const TarvexSAPKey ec(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, other.get()), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, ec.get()), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, static_cast<EVP_PKEY *>(nullptr)), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER + Bytes{0}, pki.setup.key.get()), std::invalid_argument);
    EXPECT_THROW(TarvexSAPServer(pki.setupDER, std::string_view("not a key")), std::invalid_argument);
    pki.trust();
    TarvexSAPServer fromPEM(pki.setupDER, TarvexSAPKeyToPEM(pki.setup.key.get()));
    EXPECT_EQ(fromPEM.setupCertificateDER(), pki.setupDER);
    Device device;
    EXPECT_TRUE(associate(device, fromPEM, "S", pki.setupDER));
}

TEST(CertsToolingTest, RefusesWhatDoesNotParseAndKeepsKeysFromSeeds) {
    const TarvexSAPCredential root = TarvexSAPMakeRoot("Tooling");
    const Bytes der = TarvexSAPCertToDER(root.certificate.get());
    EXPECT_THROW(TarvexSAPCertFromPEM("garbage"), std::runtime_error);
    EXPECT_THROW(TarvexSAPCertFromDER(der + Bytes{0}), std::runtime_error);
    EXPECT_THROW(TarvexSAPKeyFromPEM("garbage"), std::runtime_error);
    EXPECT_THROW(TarvexSAPKeyFromDER(Bytes(10, 0)), std::runtime_error);
    EXPECT_THROW(TarvexSAPMakeRoot(""), std::runtime_error);
    EXPECT_EQ(TarvexSAPCertToDER(TarvexSAPCertFromPEM(TarvexSAPCertToPEM(root.certificate.get())).get()), der);
    EXPECT_EQ(EVP_PKEY_eq(TarvexSAPKeyFromDER(TarvexSAPKeyToDER(root.key.get())).get(), root.key.get()), 1);
    // Strict verification wants key identifiers on both certificates.
    const TarvexSAPCredential setup = TarvexSAPIssueSetupCertificate(root, "Tooling Setup");
    for (X509 *cert : {root.certificate.get(), setup.certificate.get()}) {
        EXPECT_TRUE(X509_get0_subject_key_id(cert) != nullptr && X509_get0_authority_key_id(cert) != nullptr);
    }
    // The fuzz targets' seed corpora rely on a fixed seed giving a fixed key.
    const std::array<uint8_t, 32> seed{7};
    EXPECT_EQ(EVP_PKEY_eq(TarvexSAPEd25519KeyFromSeed(seed).get(), TarvexSAPEd25519KeyFromSeed(seed).get()), 1);
}

} // namespace
