// TarvexSAPServer, and device and server together once associated: which handshake requests are
// answered, each request passes the replay window once and each response is taken once,
// associations are replaced, expire and are swept; also the server's set-up and the certificate
// tooling. The request layout, and forged or altered signatures on either side, are the fuzz
// targets' properties (fuzz/tarvexsap), each with its seeds.
#include <gtest/gtest.h>

#include "tsap_test_support.h"

using namespace tsaptest;
using Status = TarvexSAPServerStatus;
using std::chrono::seconds;

namespace {

constexpr int32_t INVALID = kTarvexSAPErrorSignatureInvalid;

class ServerTest : public TsapTest {
 protected:
  // The server's signature of the response to `seq`.
  Bytes response(uint64_t seq, const Bytes& body) {
    const auto r = server_->signResponse("S", seq, body);
    EXPECT_EQ(r.status, Status::ok);
    return Bytes(r.signature.begin(), r.signature.end());
  }
  Status submit(Device& device, const char* session) {
    Bytes signature;
    EXPECT_EQ(device.sign(bytesOf(session), &signature), kTarvexSAPOK);
    return server_->verifyRequest(session, signature, bytesOf(session)).status;
  }
};

TEST_F(ServerTest, AnswersRequestsUnderAnAcceptableIdentifierWithAUsableKey) {
  TarvexHWInfo_ hw{20, {}};
  std::fill_n(hw.ID, 20, 0x41);
  Device device(hw), shortID(TarvexHWInfo_{3, {1, 2, 3}});
  Bytes good = device.exchange(pki_.setupDER).out;
  ASSERT_EQ(server_->handshake("S", shortID.exchange(pki_.setupDER).out, seconds(60)).status, Status::ok);
  const std::string longest(TarvexSAPServer::kMaxSessionIdentifierLength, 'A');
  EXPECT_EQ(server_->handshake("", good, seconds(60)).status, Status::malformed);
  EXPECT_EQ(server_->handshake(longest + "A", good, seconds(60)).status, Status::malformed);
  EXPECT_EQ(server_->handshake(longest, good, seconds(60)).status, Status::ok);
  std::fill_n(good.begin() + 26, 32, 0);  // a low-order client key
  EXPECT_EQ(server_->handshake("T", good, seconds(60)).status, Status::malformed);
  EXPECT_EQ(server_->associationCount(), 2u);
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
  const auto accepted = server_->verifyRequest("S", second, body);
  EXPECT_TRUE(accepted.status == Status::ok && accepted.seq == 2);  // the device counts from 1
  EXPECT_EQ(server_->verifyRequest("S", second, body).status, Status::replay);
  EXPECT_EQ(server_->verifyRequest("S", first, body).status, Status::ok);  // late, inside the window
  EXPECT_EQ(server_->verifyRequest("S", first, body).status, Status::replay);

  // seq 1 is outstanding, so only the key and label tell a request from a response.
  EXPECT_EQ(device.verify(first, body), INVALID);
  EXPECT_EQ(device.verify(first + Bytes{0}, body), kTarvexSAPErrorMalformedMessage);
  EXPECT_EQ(server_->verifyRequest("S", response(3, body), body).status, Status::badSignature);
  EXPECT_EQ(device.verify(response(3, body), body), INVALID);  // never issued
  EXPECT_EQ(device.verify(response(1, body), body), kTarvexSAPOK);
  EXPECT_EQ(device.verify(response(1, body), body), INVALID);  // answered
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
  ASSERT_TRUE(associate(renewed, *server_, "S", pki_.setupDER));  // replaces, with a fresh window
  ASSERT_TRUE(associate(other, *server_, "L", pki_.setupDER));
  EXPECT_EQ(submit(old, "S"), Status::badSignature);
  EXPECT_EQ(submit(renewed, "S"), Status::ok);
  EXPECT_EQ(submit(renewed, "L"), Status::badSignature);  // another session's keys
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
  EXPECT_EQ(server_->dropExpired(), 3u);  // S, L and Z
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
  const TarvexSAPKey other = *TarvexSAPGenerateEd25519Key();
  const TarvexSAPKey ec(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
  // clang-format off
  const std::pair<platform::Result<std::unique_ptr<TarvexSAPServer>>, const char*> refused[] = {
      {TarvexSAPServer::create(pki.setupDER, other.get()), "setup key does not belong to the setup certificate"},
      {TarvexSAPServer::create(pki.setupDER, ec.get()), "setup key is not an Ed25519 key"},
      {TarvexSAPServer::create(pki.setupDER, static_cast<EVP_PKEY*>(nullptr)), "setup key is not an Ed25519 key"},
      {TarvexSAPServer::create(pki.setupDER + Bytes{0}, pki.setup.key.get()), "setup certificate is not one DER certificate"},
      {TarvexSAPServer::create(pki.setupDER, std::string_view("not a key")), "setup key is not an Ed25519 key"},
  };
  // clang-format on
  for (const auto& [made, why] : refused) {
    EXPECT_EQ(made ? "made" : made.error(), why);
  }
  pki.trust();
  const std::unique_ptr<TarvexSAPServer> fromPEM =
      *TarvexSAPServer::create(pki.setupDER, *TarvexSAPKeyToPEM(pki.setup.key.get()));
  EXPECT_EQ(fromPEM->setupCertificateDER(), pki.setupDER);
  Device device;
  EXPECT_TRUE(associate(device, *fromPEM, "S", pki.setupDER));
}

TEST(CertsToolingTest, RefusesWhatDoesNotParseAndKeepsKeysFromSeeds) {
  const TarvexSAPCredential root = *TarvexSAPMakeRoot("Tooling");
  const Bytes der = *TarvexSAPCertToDER(root.certificate.get());
  const auto why = [](const auto& result) { return result ? std::string("accepted") : result.error(); };
  const std::pair<std::string, const char*> refused[] = {
      {why(TarvexSAPCertFromPEM("garbage")), "certificate from PEM"},
      {why(TarvexSAPCertFromDER(der + Bytes{0})), "certificate from DER"},
      {why(TarvexSAPKeyFromPEM("garbage")), "key from PEM"},
      {why(TarvexSAPKeyFromDER(Bytes(10, 0))), "key from DER"},
      {why(TarvexSAPMakeRoot("")), "empty common name"},
  };
  for (const auto& [error, step] : refused) {
    EXPECT_EQ(error, std::string("SAP certificate tooling: ") + step);
  }
  EXPECT_EQ(*TarvexSAPCertToDER(TarvexSAPCertFromPEM(*TarvexSAPCertToPEM(root.certificate.get()))->get()), der);
  EXPECT_EQ(EVP_PKEY_eq(TarvexSAPKeyFromDER(*TarvexSAPKeyToDER(root.key.get()))->get(), root.key.get()), 1);
  // The fuzz targets' seed corpora rely on a fixed seed giving a fixed key.
  const std::array<uint8_t, 32> seed{7};
  EXPECT_EQ(EVP_PKEY_eq(TarvexSAPEd25519KeyFromSeed(seed)->get(), TarvexSAPEd25519KeyFromSeed(seed)->get()), 1);
}

}  // namespace
