// The first exchange: which setup certificates the device accepts, and the trust anchor
// configuration that decides it.
#include "tsap_test_support.h"

#include <gtest/gtest.h>

#include <openssl/x509v3.h>

#include <chrono>

using namespace tsaptest;
using std::chrono::hours;

namespace {

// A certificate under `root` with hand-picked basicConstraints and keyUsage (null: omitted),
// for shapes the tooling deliberately does not make.
Bytes issueCustom(const TarvexSAPCredential &root, const char *basicConstraints, const char *keyUsage) {
    const TarvexSAPKey key = TarvexSAPGenerateEd25519Key();
    TarvexSAPCert cert(X509_new());
    X509_set_version(cert.get(), X509_VERSION_3);
    ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), 4242);
    X509_NAME *name = X509_NAME_new();
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char *>("Custom"), -1, -1, 0);
    X509_set_subject_name(cert.get(), name);
    X509_NAME_free(name);
    X509_set_issuer_name(cert.get(), X509_get_subject_name(root.certificate.get()));
    X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600);
    X509_gmtime_adj(X509_getm_notAfter(cert.get()), 3600);
    X509_set_pubkey(cert.get(), key.get());
    auto add = [&](int nid, const char *value) {
        X509V3_CTX ctx;
        X509V3_set_ctx_nodb(&ctx);
        X509V3_set_ctx(&ctx, root.certificate.get(), cert.get(), nullptr, nullptr, 0);
        X509_EXTENSION *ext = X509V3_EXT_nconf_nid(nullptr, &ctx, nid, value);
        ASSERT_NE(ext, nullptr);
        X509_add_ext(cert.get(), ext, -1);
        X509_EXTENSION_free(ext);
    };
    if (basicConstraints != nullptr) {
        add(NID_basic_constraints, basicConstraints);
    }
    if (keyUsage != nullptr) {
        add(NID_key_usage, keyUsage);
    }
    add(NID_subject_key_identifier, "hash");
    add(NID_authority_key_identifier, "keyid:always");
    EXPECT_GT(X509_sign(cert.get(), root.key.get(), nullptr), 0);
    return TarvexSAPCertToDER(cert.get());
}

class CertificateAcceptanceTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Acceptance");
        pki_.trust();
    }

    // Status of a first exchange with the given bytes, on a fresh context.
    int32_t firstExchange(const Bytes &certificate) {
        Device device;
        EXPECT_EQ(device.initStatus(), kTarvexSAPOK);
        const ExchangeResult r = device.exchange(certificate);
        EXPECT_FALSE(r.outReturned && r.status != kTarvexSAPOK) << "buffer returned on failure";
        if (r.status == kTarvexSAPOK) {
            EXPECT_EQ(r.returnCode, 1);
            EXPECT_EQ(r.out.size(), 90u);
        }
        return r.status;
    }

    Bytes issue(const TarvexSAPValidity &validity, EVP_PKEY *subjectKey = nullptr) {
        return TarvexSAPCertToDER(
            TarvexSAPIssueSetupCertificate(pki_.root, "Acceptance Setup", validity, subjectKey).certificate.get());
    }

    TestPKI pki_;
};

TEST_F(CertificateAcceptanceTest, ValidSetupCertificateInBothEncodings) {
    EXPECT_EQ(firstExchange(pki_.setupDER), kTarvexSAPOK);
    EXPECT_EQ(firstExchange(bytesOf(TarvexSAPCertToPEM(pki_.setup.certificate.get()))), kTarvexSAPOK);
}

TEST_F(CertificateAcceptanceTest, ValidityDatesAreEnforced) {
    const TarvexSAPValidity expired{-hours(48), -hours(24)};
    const TarvexSAPValidity notYetValid{hours(24), hours(48)};
    EXPECT_EQ(firstExchange(issue(expired)), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(issue(notYetValid)), kTarvexSAPErrorCertificateRejected);
}

TEST_F(CertificateAcceptanceTest, RootServedAsSetupCertificateIsRefused) {
    const Bytes rootDER = TarvexSAPCertToDER(pki_.root.certificate.get());
    EXPECT_EQ(firstExchange(rootDER), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(bytesOf(pki_.rootPEM)), kTarvexSAPErrorCertificateRejected);
}

TEST_F(CertificateAcceptanceTest, LeafMustBeNoCAAndMustSign) {
    // The hand-built shape is acceptable when it matches a setup certificate...
    EXPECT_EQ(firstExchange(issueCustom(pki_.root, "critical,CA:FALSE", "critical,digitalSignature")), kTarvexSAPOK);
    // ...and refused as soon as it is a CA, even one allowed to sign.
    EXPECT_EQ(firstExchange(issueCustom(pki_.root, "critical,CA:TRUE", "critical,digitalSignature,keyCertSign")),
              kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(issueCustom(pki_.root, "critical,CA:FALSE", "critical,nonRepudiation")),
              kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(issueCustom(pki_.root, "critical,CA:FALSE", nullptr)), kTarvexSAPErrorCertificateRejected);
}

TEST_F(CertificateAcceptanceTest, NonEd25519LeafIsRefused) {
    TarvexSAPKey ec(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    ASSERT_TRUE(ec);
    TarvexSAPKey x25519(EVP_PKEY_Q_keygen(nullptr, nullptr, "X25519"));
    ASSERT_TRUE(x25519);
    EXPECT_EQ(firstExchange(issue({}, ec.get())), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(issue({}, x25519.get())), kTarvexSAPErrorCertificateRejected);
}

TEST_F(CertificateAcceptanceTest, CertificateOfAnotherRootIsRefused) {
    const TestPKI stranger = TestPKI::make("Stranger");
    EXPECT_EQ(firstExchange(stranger.setupDER), kTarvexSAPErrorCertificateRejected);
    // Same subject and issuer names, different keys: names alone must not chain.
    const TestPKI lookalike = TestPKI::make("Acceptance");
    EXPECT_EQ(firstExchange(lookalike.setupDER), kTarvexSAPErrorCertificateRejected);
}

TEST_F(CertificateAcceptanceTest, UnparsableInputIsRefused) {
    Bytes trailing = pki_.setupDER;
    trailing.push_back(0);
    Bytes truncated(pki_.setupDER.begin(), pki_.setupDER.end() - 1);
    Bytes flipped = pki_.setupDER;
    flipped[flipped.size() - 10] ^= 0x01; // inside the signature
    const std::string pem = TarvexSAPCertToPEM(pki_.setup.certificate.get());

    EXPECT_EQ(firstExchange({}), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(trailing), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(truncated), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(flipped), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(bytesOf("-----BEGIN CERTIFICATE-----\nnot base64\n")),
              kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(bytesOf(pem.substr(0, pem.size() / 2))), kTarvexSAPErrorCertificateRejected);
    // PEM is only recognised at the very start.
    EXPECT_EQ(firstExchange(bytesOf("\n" + pem)), kTarvexSAPErrorCertificateRejected);
}

TEST_F(CertificateAcceptanceTest, RejectedCertificateEndsTheContext) {
    Device device;
    EXPECT_EQ(device.exchange(TestPKI::make("Other").setupDER).status, kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(device.exchange(pki_.setupDER).status, kTarvexSAPErrorWrongState);
}

TEST_F(CertificateAcceptanceTest, TrustAnchorCanBeReplaced) {
    const TestPKI next = TestPKI::make("Next");
    Device before; // keeps the anchor it was created under
    next.trust();
    Device after;
    EXPECT_EQ(before.exchange(pki_.setupDER).status, kTarvexSAPOK);
    EXPECT_EQ(after.exchange(pki_.setupDER).status, kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(firstExchange(next.setupDER), kTarvexSAPOK);
}

TEST_F(CertificateAcceptanceTest, AnchorFileMayHoldSeveralRoots) {
    const TestPKI second = TestPKI::make("Second");
    const std::string both = pki_.rootPEM + second.rootPEM;
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t *>(both.data()), both.size(), nullptr};
    ASSERT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
    EXPECT_EQ(firstExchange(pki_.setupDER), kTarvexSAPOK);
    EXPECT_EQ(firstExchange(second.setupDER), kTarvexSAPOK);
}

TEST_F(CertificateAcceptanceTest, BadAnchorIsRefusedAndTheOldOneKept) {
    const std::string garbage = "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n";
    const std::string broken = pki_.rootPEM + garbage;
    const TarvexSAPConfig bad{reinterpret_cast<const uint8_t *>(garbage.data()), garbage.size(), nullptr};
    const TarvexSAPConfig partlyBad{reinterpret_cast<const uint8_t *>(broken.data()), broken.size(), nullptr};
    const TarvexSAPConfig empty{nullptr, 0, nullptr};
    EXPECT_EQ(TarvexSAPConfigure(&bad), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(TarvexSAPConfigure(&partlyBad), kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(TarvexSAPConfigure(&empty), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(firstExchange(pki_.setupDER), kTarvexSAPOK);
}

} // namespace
