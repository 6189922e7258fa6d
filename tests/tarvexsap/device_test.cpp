// The device side: which setup certificates and session infos complete an association, its
// argument and state rules, the handshake request and its hardware identifier, the trust anchor,
// the live-handle registry and the status numbers.
#include <gtest/gtest.h>
#include <openssl/x509v3.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <optional>

#include "tarvexsap/tsap_crypto.h"
#include "tarvexsap/tsap_protocol.h"
#include "tarvexsap/tsap_registry.h"
#include "tsap_test_support.h"

using namespace tsaptest;
using std::chrono::hours;

namespace {

constexpr int32_t OK = kTarvexSAPOK;
constexpr int32_t BAD_ARGUMENT = kTarvexSAPErrorBadArgument;
constexpr int32_t WRONG_STATE = kTarvexSAPErrorWrongState;
constexpr int32_t UNKNOWN = kTarvexSAPErrorUnknownHandle;
constexpr int32_t REJECTED = kTarvexSAPErrorCertificateRejected;
constexpr int32_t MALFORMED = kTarvexSAPErrorMalformedMessage;
constexpr int32_t INVALID = kTarvexSAPErrorSignatureInvalid;

class DeviceTest : public TsapTest {};

Bytes issue(const TestPKI& p, const TarvexSAPValidity& validity, TarvexSAPKey key = nullptr) {
  return *TarvexSAPCertToDER(TarvexSAPIssueSetupCertificate(p.root, "Other", validity, key.get())->certificate.get());
}

// A setup certificate with its basicConstraints and keyUsage replaced (null: left out), for
// shapes the tooling does not make.
Bytes reshape(const TestPKI& p, const char* basicConstraints, const char* keyUsage) {
  const TarvexSAPCredential leaf = *TarvexSAPIssueSetupCertificate(p.root, "Reshaped");
  X509* cert = leaf.certificate.get();
  for (const auto& [nid, value] : {std::pair{NID_basic_constraints, basicConstraints}, {NID_key_usage, keyUsage}}) {
    X509_EXTENSION_free(X509_delete_ext(cert, X509_get_ext_by_NID(cert, nid, -1)));
    X509V3_CTX ctx;
    X509V3_set_ctx_nodb(&ctx);
    X509V3_set_ctx(&ctx, p.root.certificate.get(), cert, nullptr, nullptr, 0);
    X509_EXTENSION* ext = value != nullptr ? X509V3_EXT_nconf_nid(nullptr, &ctx, nid, value) : nullptr;
    EXPECT_TRUE(value == nullptr || X509_add_ext(cert, ext, -1) == 1);
    X509_EXTENSION_free(ext);
  }
  EXPECT_GT(X509_sign(cert, p.root.key.get(), nullptr), 0);
  return *TarvexSAPCertToDER(cert);
}

const struct {
  const char* name;
  Bytes (*certificate)(const TestPKI&);
  int32_t status;
} kCertificates[] = {
    // clang-format off
    {"DER", [](const TestPKI &p) { return p.setupDER; }, OK},
    {"PEM", [](const TestPKI &p) { return bytesOf(*TarvexSAPCertToPEM(p.setup.certificate.get())); }, OK},
    {"hand-built, same shape", [](const TestPKI &p) { return reshape(p, "critical,CA:FALSE", "critical,digitalSignature"); }, OK},
    {"expired", [](const TestPKI &p) { return issue(p, {-hours(48), -hours(24)}); }, REJECTED},
    {"a CA allowed to sign", [](const TestPKI &p) { return reshape(p, "critical,CA:TRUE", "critical,digitalSignature,keyCertSign"); }, REJECTED},
    {"no digitalSignature", [](const TestPKI &p) { return reshape(p, "critical,CA:FALSE", "critical,nonRepudiation"); }, REJECTED},
    {"no keyUsage", [](const TestPKI &p) { return reshape(p, "critical,CA:FALSE", nullptr); }, REJECTED},
    {"EC key", [](const TestPKI &p) { return issue(p, {}, TarvexSAPKey(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"))); }, REJECTED},
    {"another root's", [](const TestPKI &) { return TestPKI("Stranger").setupDER; }, REJECTED},
    {"empty", [](const TestPKI &) { return Bytes(); }, REJECTED},
    {"a byte after it", [](const TestPKI &p) { return p.setupDER + Bytes{0}; }, REJECTED},
    {"PEM after a newline", [](const TestPKI &p) { return bytesOf("\n" + *TarvexSAPCertToPEM(p.setup.certificate.get())); }, REJECTED},
    // clang-format on
};

TEST_F(DeviceTest, AcceptsOnlyAFitSetupCertificateUnderTheAnchor) {
  for (const auto& c : kCertificates) {
    SCOPED_TRACE(c.name);
    Device device;
    const Exchanged r = device.exchange(c.certificate(pki_));
    EXPECT_EQ(r.status, c.status);
    EXPECT_EQ(r.outReturned, c.status == OK);
    EXPECT_EQ(r.returnCode, c.status == OK ? 1 : 255);
    // Either way the certificate had its turn: what follows is read as a session info, or refused.
    EXPECT_EQ(device.exchange(pki_.setupDER).status, c.status == OK ? MALFORMED : WRONG_STATE);
  }
}

// `info` with its first 65 bytes signed by `signer` for `request`, as a server holding that key
// would answer.
Bytes resign(const Bytes& request, Bytes info, EVP_PKEY* signer) {
  tsap::RequestBytes requestBytes{};
  tsap::SessionInfoBytes infoBytes{};
  std::copy_n(request.begin(), requestBytes.size(), requestBytes.begin());
  std::copy_n(info.begin(), 65, infoBytes.begin());
  tsap::Digest t{};
  EXPECT_TRUE(tsap::transcriptHash(requestBytes, infoBytes, t) &&
              tsap::ed25519Sign(signer, t, std::span<uint8_t, 64>(info.data() + 65, 64)));
  return info;
}
using P = const TestPKI&;
using B = const Bytes&;

// Altered infos, other versions and low-order server keys are the session-info fuzz target's seeds.
const struct {
  const char* name;
  Bytes (*info)(const TestPKI&, const Bytes& request, const Bytes& genuine);
  int32_t status;
} kInfos[] = {
    // clang-format off
    {"genuine", [](P, B, B g) { return g; }, OK},
    {"signed by a sibling's key", [](P p, B r, B g) { return resign(r, g, TarvexSAPIssueSetupCertificate(p.root, "Sibling")->key.get()); }, INVALID},
    {"answers another request", [](P p, B, B g) { return resign(Bytes(90, 1), g, p.setup.key.get()); }, INVALID},
    {"128 bytes", [](P, B, B g) { return Bytes(g.begin(), g.end() - 1); }, MALFORMED},
    {"130 bytes", [](P, B, B g) { return g + Bytes{0}; }, MALFORMED},
    // clang-format on
};

TEST_F(DeviceTest, CompletesTheAssociationOnlyWithTheSetupKeysAnswerToItsRequest) {
  for (const auto& c : kInfos) {
    SCOPED_TRACE(c.name);
    Device device;
    const Bytes request = device.exchange(pki_.setupDER).out;
    const auto answer = server_->handshake("S", request, hours(1));
    const Bytes genuine(answer.sessionInfo.begin(), answer.sessionInfo.end());
    const Exchanged r = device.exchange(c.info(pki_, request, genuine));
    EXPECT_EQ(r.status, c.status);
    EXPECT_FALSE(r.outReturned);
    EXPECT_EQ(r.returnCode, c.status == OK ? 0 : 255);
    // Either way the handshake is over: a late or repeated genuine answer is out of turn.
    EXPECT_EQ(device.exchange(genuine).status, WRONG_STATE);
    Bytes signature;
    EXPECT_EQ(device.sign(bytesOf("x"), &signature), c.status == OK ? OK : WRONG_STATE);
    EXPECT_EQ(server_->verifyRequest("S", signature, bytesOf("x")).status == TarvexSAPServerStatus::ok, c.status == OK);
  }
}

TEST_F(DeviceTest, ArgumentsAreCheckedBeforeTheStateAndNothingIsWrittenWhenRefused) {
  Device device;
  const Bytes& cert = pki_.setupDER;
  QVSAPContextOpaque_ *h = device.handle, *none = nullptr;
  TarvexHWInfo_ &hw = device.hw, overlong{21, {}};
  uint8_t *out = nullptr, *sig = nullptr;
  uint8_t byte = 0, code = 255;
  uint32_t len = 0;
  const struct {
    const char* name;
    int32_t status, expected;
  } calls[] = {
      // clang-format off
        {"init, identifier over 20", TarvexSAPInit(&none, &overlong), BAD_ARGUMENT},
        {"init, no handle", TarvexSAPInit(nullptr, &hw), BAD_ARGUMENT},
        {"init, no hwInfo", TarvexSAPInit(&none, nullptr), BAD_ARGUMENT},
        {"selector 201", device.exchange(cert, 201).status, BAD_ARGUMENT},
        {"no hwInfo", TarvexSAPExchange(200, nullptr, h, cert.data(), cert.size(), &out, &len, &code), BAD_ARGUMENT},
        {"identifier over 20", TarvexSAPExchange(200, &overlong, h, cert.data(), cert.size(), &out, &len, &code), BAD_ARGUMENT},
        {"no handle", TarvexSAPExchange(200, &hw, nullptr, cert.data(), cert.size(), &out, &len, &code), BAD_ARGUMENT},
        {"no input", TarvexSAPExchange(200, &hw, h, nullptr, cert.size(), &out, &len, &code), BAD_ARGUMENT},
        {"no out", TarvexSAPExchange(200, &hw, h, cert.data(), cert.size(), nullptr, &len, &code), BAD_ARGUMENT},
        {"no outLen", TarvexSAPExchange(200, &hw, h, cert.data(), cert.size(), &out, nullptr, &code), BAD_ARGUMENT},
        {"no returnCode", TarvexSAPExchange(200, &hw, h, cert.data(), cert.size(), &out, &len, nullptr), BAD_ARGUMENT},
        {"sign, no handle", TarvexSAPSign(nullptr, &byte, 1, &sig, &len), BAD_ARGUMENT},
        {"sign, no data", TarvexSAPSign(h, nullptr, 1, &sig, &len), BAD_ARGUMENT},
        {"sign, no signature", TarvexSAPSign(h, &byte, 1, nullptr, &len), BAD_ARGUMENT},
        {"sign, no length", TarvexSAPSign(h, &byte, 1, &sig, nullptr), BAD_ARGUMENT},
        {"verify, no handle", TarvexSAPVerify(nullptr, &byte, 1, &byte, 1), BAD_ARGUMENT},
        {"verify, no signature", TarvexSAPVerify(h, nullptr, 40, &byte, 1), BAD_ARGUMENT},
        {"verify, no data", TarvexSAPVerify(h, &byte, 1, nullptr, 1), BAD_ARGUMENT},
        {"teardown, no handle", TarvexSAPTeardown(nullptr), BAD_ARGUMENT},
        {"sign before association", TarvexSAPSign(h, &byte, 1, &sig, &len), WRONG_STATE},
        {"verify before association", device.verify(Bytes(40, 0), bytesOf("x")), WRONG_STATE},
      // clang-format on
  };
  for (const auto& call : calls) EXPECT_EQ(call.status, call.expected) << call.name;
  EXPECT_TRUE(none == nullptr && out == nullptr && sig == nullptr && code == 255);
  // None of that used up the context's turn.
  ASSERT_TRUE(associate(device, *server_, "S", cert));
  // Empty bodies may come as null pointers.
  ASSERT_EQ(TarvexSAPSign(h, nullptr, 0, &sig, &len), OK);
  EXPECT_EQ(server_->verifyRequest("S", Bytes(sig, sig + len), {}).status, TarvexSAPServerStatus::ok);
  std::free(sig);
  const auto answer = server_->signResponse("S", 1, {});
  EXPECT_EQ(TarvexSAPVerify(h, answer.signature.data(), answer.signature.size(), nullptr, 0), OK);
}

TEST(HandshakeRequestTest, CarriesTheHardwareIDFromTheMachineIDOrAGivenOrRandomOne) {
  const std::string path = ::testing::TempDir() + "tsap-machine-id", hex = "0123456789abcdef0123456789ABCDEF";
  const TestPKI pki("HardwareID");
  pki.trust(path.c_str());
  const Bytes derived = fromHex("e110d3cb7079040e8eb07e7e6bd6f317f763ae82");  // SHA-256("TSAP1 hwid" || hex)
  const std::pair<std::optional<std::string>, bool> rows[] = {{hex + "\n", true},     {hex, true},
                                                              {hex.substr(1), false}, {hex + "0", false},
                                                              {hex + "\n\n", false},  {hex.substr(1) + "g", false},
                                                              {std::nullopt, false}};
  for (const auto& [machineID, usable] : rows) {
    SCOPED_TRACE(machineID.value_or("(no file)"));
    std::remove(path.c_str());
    if (machineID) std::ofstream(path, std::ios::binary) << *machineID;
    Device a, b;
    const Bytes idA(a.hw.ID, a.hw.ID + 20), idB(b.hw.ID, b.hw.ID + 20);
    EXPECT_EQ(a.hw.IDLength, 20u);
    EXPECT_EQ(idA == derived, usable);
    EXPECT_EQ(idA == idB, usable);  // random otherwise
    const Bytes request = a.exchange(pki.setupDER).out;
    ASSERT_EQ(request.size(), 90u);
    EXPECT_EQ(Bytes(request.begin(), request.begin() + 26), fromHex("545341500114") + idA);
  }
  std::remove(path.c_str());
  // A given identifier is kept, and only its first IDLength bytes are sent, zero-padded.
  TarvexHWInfo_ hw{7, {}};
  std::fill_n(hw.ID, 20, 0x77);
  Device a(hw), b(hw);
  EXPECT_TRUE(a.hw.IDLength == 7 && Bytes(a.hw.ID, a.hw.ID + 20) == Bytes(20, 0x77));
  const Bytes ra = a.exchange(pki.setupDER).out, rb = b.exchange(pki.setupDER).out;
  ASSERT_TRUE(ra.size() == 90 && rb.size() == 90);
  EXPECT_EQ(Bytes(ra.begin(), ra.begin() + 26), fromHex("545341500107") + Bytes(7, 0x77) + Bytes(13, 0));
  // A fresh ephemeral key (26..57) and nonce (58..89) for every context.
  EXPECT_NE(Bytes(ra.begin() + 26, ra.begin() + 58), Bytes(rb.begin() + 26, rb.begin() + 58));
  EXPECT_NE(Bytes(ra.begin() + 58, ra.end()), Bytes(rb.begin() + 58, rb.end()));
}

TEST_F(DeviceTest, TrustAnchorsCanBeReplacedAndCombinedButNotBroken) {
  const TestPKI next("Next");
  Device before;  // keeps the anchor it was created under
  next.trust();
  Device after;
  EXPECT_EQ(before.exchange(pki_.setupDER).status, OK);
  EXPECT_EQ(after.exchange(pki_.setupDER).status, REJECTED);
  const auto configure = [](const std::string& text) {
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(text.data()), text.size(), nullptr};
    return TarvexSAPConfigure(&config);
  };
  ASSERT_EQ(configure(pki_.rootPEM + next.rootPEM), OK);
  const std::string garbage = "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n";
  EXPECT_EQ(configure(garbage), REJECTED);
  EXPECT_EQ(configure(pki_.rootPEM + garbage), REJECTED);
  EXPECT_EQ(configure(""), BAD_ARGUMENT);
  for (const Bytes& certificate : {pki_.setupDER, next.setupDER}) {  // both roots of the last good anchor file
    Device device;
    EXPECT_EQ(device.exchange(certificate).status, OK);
  }
  ASSERT_EQ(TarvexSAPConfigure(nullptr), OK);
  Device unconfigured;
  EXPECT_TRUE(unconfigured.initStatus == kTarvexSAPErrorNotConfigured && unconfigured.handle == nullptr);
}

TEST_F(DeviceTest, HandlesAreLiveTokensNeverReused) {
  const std::size_t live = tsap::liveContextCount();
  TarvexHWInfo_ hw{};
  QVSAPContextOpaque_* handle = nullptr;
  ASSERT_EQ(TarvexSAPInit(&handle, &hw), OK);
  EXPECT_EQ(tsap::liveContextCount(), live + 1);
  const Bytes junk = bytesOf("not a certificate");
  uint8_t *out = nullptr, code = 255, data[40] = {};
  uint32_t len = 0;
  EXPECT_EQ(TarvexSAPExchange(200, &hw, handle, junk.data(), junk.size(), &out, &len, &code), REJECTED);
  EXPECT_EQ(TarvexSAPTeardown(handle), OK);  // a failed context is torn down like any other
  EXPECT_EQ(tsap::liveContextCount(), live);
  const Device fresh;
  EXPECT_NE(fresh.handle, handle);
  // Torn down, an address of real memory, a token not handed out yet: never touched, whatever the call.
  int local = 0;
  const auto next = reinterpret_cast<QVSAPContextOpaque_*>(reinterpret_cast<uintptr_t>(fresh.handle) + 1);
  for (QVSAPContextOpaque_* h : {handle, reinterpret_cast<QVSAPContextOpaque_*>(&local), next}) {
    EXPECT_EQ(TarvexSAPTeardown(h), UNKNOWN);
    EXPECT_EQ(TarvexSAPSign(h, data, 4, &out, &len), UNKNOWN);
    EXPECT_EQ(TarvexSAPVerify(h, data, 40, data, 4), UNKNOWN);
    EXPECT_EQ(TarvexSAPExchange(200, &hw, h, data, 4, &out, &len, &code), UNKNOWN);
  }
  EXPECT_TRUE(local == 0 && out == nullptr && code == 255);
}

TEST(StatusTest, NumbersAreStable) {
  // clang-format off
  const char* const names[] = {"kTarvexSAPOK", "kTarvexSAPErrorBadArgument", "kTarvexSAPErrorWrongState",
      "kTarvexSAPErrorUnknownHandle", "kTarvexSAPErrorCertificateRejected", "kTarvexSAPErrorMalformedMessage",
      "kTarvexSAPErrorSignatureInvalid", "kTarvexSAPErrorCryptoFailure", "kTarvexSAPErrorNotConfigured", "unknown"};
  // clang-format on
  for (int32_t n = 0; n < 10; ++n) EXPECT_STREQ(TarvexSAPStatusName(-n), names[n]);
}

}  // namespace
