#include "tarvexsap/tarvex_sap_certs.h"

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <ctime>
#include <limits>
#include <optional>

#include "tarvexsap/tsap_crypto.h"

namespace {

platform::Failure failure(const char* what) {
  ERR_clear_error();
  return platform::Failure{std::string("SAP certificate tooling: ") + what};
}

struct BioFree {
  void operator()(BIO* bio) const { BIO_free(bio); }
};
using BioPtr = std::unique_ptr<BIO, BioFree>;
struct NameFree {
  void operator()(X509_NAME* name) const { X509_NAME_free(name); }
};
using NamePtr = std::unique_ptr<X509_NAME, NameFree>;

platform::Result<BioPtr> readBio(std::string_view text) {
  if (text.size() > static_cast<std::size_t>(std::numeric_limits<int>::max())) {
    return failure("input too large");
  }
  BioPtr bio(BIO_new_mem_buf(text.data(), static_cast<int>(text.size())));
  if (!bio) {
    return failure("BIO_new_mem_buf");
  }
  return bio;
}

std::string drain(BIO* bio) {
  char* data = nullptr;
  const long len = BIO_get_mem_data(bio, &data);
  return std::string(data, static_cast<std::size_t>(len));
}

platform::Done setRandomSerial(X509* cert) {
  // 64 positive bits, never zero: unique enough and valid under strict checks.
  std::array<uint8_t, 8> bytes{};
  if (!tsap::randomBytes(bytes)) {
    return failure("RAND_bytes");
  }
  bytes[0] = static_cast<uint8_t>((bytes[0] & 0x7f) | 0x40);
  std::unique_ptr<BIGNUM, decltype(&BN_free)> bn(BN_bin2bn(bytes.data(), bytes.size(), nullptr), &BN_free);
  if (!bn || BN_to_ASN1_INTEGER(bn.get(), X509_get_serialNumber(cert)) == nullptr) {
    return failure("serial number");
  }
  return std::nullopt;
}

platform::Result<NamePtr> nameFor(std::string_view commonName) {
  if (commonName.empty()) {
    return failure("empty common name");
  }
  NamePtr name(X509_NAME_new());
  if (!name || X509_NAME_add_entry_by_txt(name.get(), "CN", MBSTRING_UTF8,
                                          reinterpret_cast<const unsigned char*>(commonName.data()),
                                          static_cast<int>(commonName.size()), -1, 0) != 1) {
    return failure("subject name");
  }
  return name;
}

bool addExtension(X509* cert, X509* issuer, int nid, const char* value) {
  X509V3_CTX ctx;
  X509V3_set_ctx_nodb(&ctx);
  X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
  X509_EXTENSION* ext = X509V3_EXT_nconf_nid(nullptr, &ctx, nid, value);
  const bool added = ext != nullptr && X509_add_ext(cert, ext, -1) == 1;
  X509_EXTENSION_free(ext);
  return added;
}

// Everything but extensions and signature.
platform::Result<TarvexSAPCert> newCertificate(std::string_view commonName, const X509_NAME* issuerName,
                                               EVP_PKEY* subjectKey, const TarvexSAPValidity& validity) {
  TarvexSAPCert cert(X509_new());
  if (!cert || X509_set_version(cert.get(), X509_VERSION_3) != 1) {
    return failure("X509_new");
  }
  if (auto failed = setRandomSerial(cert.get())) {
    return std::move(*failed);
  }
  platform::Result<NamePtr> subject = nameFor(commonName);
  if (!subject) {
    return platform::Failure{subject.error()};
  }
  const bool named = X509_set_subject_name(cert.get(), subject->get()) == 1 &&
                     X509_set_issuer_name(cert.get(), issuerName != nullptr ? issuerName : subject->get()) == 1;
  // One reading of the clock for both ends, so the validity span is exactly what was asked.
  time_t now = time(nullptr);
  if (!named ||
      X509_time_adj(X509_getm_notBefore(cert.get()), static_cast<long>(validity.notBefore.count()), &now) == nullptr ||
      X509_time_adj(X509_getm_notAfter(cert.get()), static_cast<long>(validity.notAfter.count()), &now) == nullptr ||
      X509_set_pubkey(cert.get(), subjectKey) != 1) {
    return failure("certificate fields");
  }
  return cert;
}

platform::Result<TarvexSAPKey> takeOrGenerate(EVP_PKEY* key) {
  if (key == nullptr) {
    return TarvexSAPGenerateEd25519Key();
  }
  if (EVP_PKEY_up_ref(key) != 1) {
    return failure("EVP_PKEY_up_ref");
  }
  return TarvexSAPKey(key);
}

// What sets a root apart from a setup certificate.
struct Profile {
  const char* basicConstraints;
  const char* keyUsage;
  const char* signatureStep;  // names the signing in a failure
};

// A certificate of `subjectKey` (null: a fresh key) issued by `issuer`, or self-signed when it is null.
platform::Result<TarvexSAPCredential> certify(std::string_view commonName, const TarvexSAPCredential* issuer,
                                              EVP_PKEY* subjectKey, const TarvexSAPValidity& validity,
                                              const Profile& profile) {
  platform::Result<TarvexSAPKey> key = takeOrGenerate(subjectKey);
  if (!key) {
    return platform::Failure{key.error()};
  }
  const X509_NAME* issuerName = issuer != nullptr ? X509_get_subject_name(issuer->certificate.get()) : nullptr;
  platform::Result<TarvexSAPCert> made = newCertificate(commonName, issuerName, key->get(), validity);
  if (!made) {
    return platform::Failure{made.error()};
  }
  X509* cert = made->get();
  X509* issuerCert = issuer != nullptr ? issuer->certificate.get() : cert;
  // The subject key identifier must exist before the authority one can refer to it.
  if (!addExtension(cert, issuerCert, NID_basic_constraints, profile.basicConstraints) ||
      !addExtension(cert, issuerCert, NID_key_usage, profile.keyUsage) ||
      !addExtension(cert, issuerCert, NID_subject_key_identifier, "hash") ||
      !addExtension(cert, issuerCert, NID_authority_key_identifier, "keyid:always")) {
    return failure("extension");
  }
  if (X509_sign(cert, issuer != nullptr ? issuer->key.get() : key->get(), nullptr) <= 0) {
    return failure(profile.signatureStep);
  }
  return TarvexSAPCredential{std::move(*made), std::move(*key)};
}

}  // namespace

platform::Result<TarvexSAPKey> TarvexSAPGenerateEd25519Key() {
  TarvexSAPKey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "ED25519"));
  if (!key) {
    return failure("Ed25519 key generation");
  }
  return key;
}

platform::Result<TarvexSAPKey> TarvexSAPEd25519KeyFromSeed(std::span<const uint8_t, 32> seed) {
  TarvexSAPKey key(EVP_PKEY_new_raw_private_key_ex(nullptr, "ED25519", nullptr, seed.data(), seed.size()));
  if (!key) {
    return failure("Ed25519 key from seed");
  }
  return key;
}

platform::Result<TarvexSAPCredential> TarvexSAPMakeRoot(std::string_view commonName, const TarvexSAPValidity& validity,
                                                        EVP_PKEY* key) {
  return certify(commonName, nullptr, key, validity,
                 Profile{"critical,CA:TRUE", "critical,keyCertSign,cRLSign", "root signature"});
}

platform::Result<TarvexSAPCredential> TarvexSAPIssueSetupCertificate(const TarvexSAPCredential& root,
                                                                     std::string_view commonName,
                                                                     const TarvexSAPValidity& validity,
                                                                     EVP_PKEY* subjectKey) {
  if (!root.certificate || !root.key) {
    return failure("root credential incomplete");
  }
  return certify(commonName, &root, subjectKey, validity,
                 Profile{"critical,CA:FALSE", "critical,digitalSignature", "setup certificate signature"});
}

platform::Result<std::string> TarvexSAPCertToPEM(const X509* cert) {
  BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || cert == nullptr || PEM_write_bio_X509(bio.get(), cert) != 1) {
    return failure("certificate to PEM");
  }
  return drain(bio.get());
}

platform::Result<std::vector<uint8_t>> TarvexSAPCertToDER(const X509* cert) {
  unsigned char* der = nullptr;
  const int len = cert != nullptr ? i2d_X509(cert, &der) : -1;
  if (len <= 0) {
    return failure("certificate to DER");
  }
  std::vector<uint8_t> out(der, der + len);
  OPENSSL_free(der);
  return out;
}

platform::Result<TarvexSAPCert> TarvexSAPCertFromPEM(std::string_view pem) {
  platform::Result<BioPtr> bio = readBio(pem);
  if (!bio) {
    return platform::Failure{bio.error()};
  }
  TarvexSAPCert cert(PEM_read_bio_X509(bio->get(), nullptr, nullptr, nullptr));
  if (!cert) {
    return failure("certificate from PEM");
  }
  return cert;
}

platform::Result<TarvexSAPCert> TarvexSAPCertFromDER(std::span<const uint8_t> der) {
  const unsigned char* p = der.data();
  TarvexSAPCert cert(der.empty() ? nullptr : d2i_X509(nullptr, &p, static_cast<long>(der.size())));
  if (!cert || p != der.data() + der.size()) {
    return failure("certificate from DER");
  }
  return cert;
}

platform::Result<std::string> TarvexSAPKeyToPEM(const EVP_PKEY* key) {
  BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || key == nullptr || PEM_write_bio_PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    return failure("key to PEM");
  }
  return drain(bio.get());
}

platform::Result<std::vector<uint8_t>> TarvexSAPKeyToDER(const EVP_PKEY* key) {
  std::unique_ptr<PKCS8_PRIV_KEY_INFO, decltype(&PKCS8_PRIV_KEY_INFO_free)> p8(
      key != nullptr ? EVP_PKEY2PKCS8(key) : nullptr, &PKCS8_PRIV_KEY_INFO_free);
  unsigned char* der = nullptr;
  const int len = p8 ? i2d_PKCS8_PRIV_KEY_INFO(p8.get(), &der) : -1;
  if (len <= 0) {
    return failure("key to DER");
  }
  std::vector<uint8_t> out(der, der + len);
  OPENSSL_clear_free(der, static_cast<std::size_t>(len));
  return out;
}

platform::Result<TarvexSAPKey> TarvexSAPKeyFromPEM(std::string_view pem) {
  platform::Result<BioPtr> bio = readBio(pem);
  if (!bio) {
    return platform::Failure{bio.error()};
  }
  TarvexSAPKey key(PEM_read_bio_PrivateKey(bio->get(), nullptr, nullptr, nullptr));
  if (!key) {
    return failure("key from PEM");
  }
  return key;
}

platform::Result<TarvexSAPKey> TarvexSAPKeyFromDER(std::span<const uint8_t> der) {
  const unsigned char* p = der.data();
  TarvexSAPKey key(der.empty() ? nullptr : d2i_AutoPrivateKey(nullptr, &p, static_cast<long>(der.size())));
  if (!key) {
    return failure("key from DER");
  }
  return key;
}
