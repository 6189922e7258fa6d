// The certificate tooling: the extensions strict verification relies on, encodings, validity
// offsets and reproducible keys.
#include "tarvexsap/tarvex_sap_certs.h"

#include <gtest/gtest.h>

#include <openssl/x509v3.h>

#include <stdexcept>

namespace {

const ASN1_OCTET_STRING *keyID(X509 *cert, int nid) {
    if (nid == NID_subject_key_identifier) {
        return X509_get0_subject_key_id(cert);
    }
    return X509_get0_authority_key_id(cert);
}

bool sameOctets(const ASN1_OCTET_STRING *a, const ASN1_OCTET_STRING *b) {
    return a != nullptr && b != nullptr && ASN1_OCTET_STRING_cmp(a, b) == 0;
}

bool criticalExtension(X509 *cert, int nid) {
    const int index = X509_get_ext_by_NID(cert, nid, -1);
    return index >= 0 && X509_EXTENSION_get_critical(X509_get_ext(cert, index)) == 1;
}

TEST(CertsToolingTest, RootAndSetupCertificateCarryTheirExtensions) {
    const TarvexSAPCredential root = TarvexSAPMakeRoot("Tooling Root");
    const TarvexSAPCredential setup = TarvexSAPIssueSetupCertificate(root, "Tooling Setup");
    X509 *r = root.certificate.get();
    X509 *s = setup.certificate.get();

    EXPECT_EQ(X509_get_version(r), X509_VERSION_3);
    EXPECT_EQ(X509_check_ca(r), 1);
    EXPECT_TRUE(criticalExtension(r, NID_basic_constraints));
    EXPECT_EQ(X509_get_key_usage(r), static_cast<uint32_t>(KU_KEY_CERT_SIGN | KU_CRL_SIGN));
    EXPECT_TRUE(sameOctets(keyID(r, NID_subject_key_identifier), keyID(r, NID_authority_key_identifier)));
    EXPECT_EQ(X509_verify(r, X509_get0_pubkey(r)), 1);
    EXPECT_EQ(EVP_PKEY_get_base_id(X509_get0_pubkey(r)), EVP_PKEY_ED25519);

    EXPECT_EQ(X509_get_version(s), X509_VERSION_3);
    EXPECT_EQ(X509_check_ca(s), 0);
    EXPECT_EQ(X509_get_key_usage(s), static_cast<uint32_t>(KU_DIGITAL_SIGNATURE));
    EXPECT_TRUE(sameOctets(keyID(s, NID_authority_key_identifier), keyID(r, NID_subject_key_identifier)));
    EXPECT_NE(keyID(s, NID_subject_key_identifier), nullptr);
    EXPECT_EQ(X509_verify(s, X509_get0_pubkey(r)), 1);
    EXPECT_EQ(X509_check_issued(r, s), X509_V_OK);
    EXPECT_EQ(X509_check_private_key(s, setup.key.get()), 1);
    EXPECT_NE(ASN1_INTEGER_cmp(X509_get0_serialNumber(r), X509_get0_serialNumber(s)), 0);
}

TEST(CertsToolingTest, EncodingsRoundTrip) {
    const TarvexSAPCredential root = TarvexSAPMakeRoot("Encodings");
    const std::vector<uint8_t> der = TarvexSAPCertToDER(root.certificate.get());
    EXPECT_EQ(TarvexSAPCertToDER(TarvexSAPCertFromDER(der).get()), der);
    EXPECT_EQ(TarvexSAPCertToDER(TarvexSAPCertFromPEM(TarvexSAPCertToPEM(root.certificate.get())).get()), der);

    const TarvexSAPKey fromPEM = TarvexSAPKeyFromPEM(TarvexSAPKeyToPEM(root.key.get()));
    const TarvexSAPKey fromDER = TarvexSAPKeyFromDER(TarvexSAPKeyToDER(root.key.get()));
    EXPECT_EQ(EVP_PKEY_eq(fromPEM.get(), root.key.get()), 1);
    EXPECT_EQ(EVP_PKEY_eq(fromDER.get(), root.key.get()), 1);
    EXPECT_EQ(X509_check_private_key(root.certificate.get(), fromDER.get()), 1);

    EXPECT_THROW(TarvexSAPCertFromPEM("garbage"), std::runtime_error);
    std::vector<uint8_t> trailing = der;
    trailing.push_back(0);
    EXPECT_THROW(TarvexSAPCertFromDER(trailing), std::runtime_error);
    EXPECT_THROW(TarvexSAPKeyFromDER(std::vector<uint8_t>(10, 0)), std::runtime_error);
    EXPECT_THROW(TarvexSAPMakeRoot(""), std::runtime_error);
}

TEST(CertsToolingTest, ValidityOffsetsAreApplied) {
    const TarvexSAPCredential root = TarvexSAPMakeRoot("Validity");
    const TarvexSAPValidity past{std::chrono::hours(-48), std::chrono::hours(-24)};
    const TarvexSAPCredential old = TarvexSAPIssueSetupCertificate(root, "Old", past);
    int days = 0;
    int secs = 0;
    ASSERT_EQ(ASN1_TIME_diff(&days, &secs, X509_get0_notBefore(old.certificate.get()),
                             X509_get0_notAfter(old.certificate.get())),
              1);
    EXPECT_EQ(days, 1);
    EXPECT_EQ(secs, 0);
    EXPECT_LT(X509_cmp_current_time(X509_get0_notAfter(old.certificate.get())), 0);
    EXPECT_GT(X509_cmp_current_time(X509_get0_notAfter(root.certificate.get())), 0);
    EXPECT_LT(X509_cmp_current_time(X509_get0_notBefore(root.certificate.get())), 0);
}

TEST(CertsToolingTest, FixedSeedGivesFixedKeyAndChain) {
    std::array<uint8_t, 32> seed{};
    seed.fill(7);
    const TarvexSAPKey a = TarvexSAPEd25519KeyFromSeed(seed);
    const TarvexSAPKey b = TarvexSAPEd25519KeyFromSeed(seed);
    EXPECT_EQ(EVP_PKEY_eq(a.get(), b.get()), 1);
    const TarvexSAPCredential rootA = TarvexSAPMakeRoot("Seeded", {}, a.get());
    const TarvexSAPCredential rootB = TarvexSAPMakeRoot("Seeded", {}, b.get());
    const TarvexSAPCredential leaf = TarvexSAPIssueSetupCertificate(rootA, "Leaf");
    // Issued under one rendering of the root, verifiable under the other.
    EXPECT_EQ(X509_verify(leaf.certificate.get(), X509_get0_pubkey(rootB.certificate.get())), 1);
    EXPECT_TRUE(sameOctets(keyID(rootA.certificate.get(), NID_subject_key_identifier),
                           keyID(rootB.certificate.get(), NID_subject_key_identifier)));
}

} // namespace
