#include "tarvexsap/tarvex_sap_certs.h"

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <ctime>
#include <limits>
#include <stdexcept>

#include "tarvexsap/tsap_crypto.h"

namespace {

[[noreturn]] void fail(const char* what) {
  ERR_clear_error();
  throw std::runtime_error(std::string("SAP certificate tooling: ") + what);
}

struct BioFree {
  void operator()(BIO* bio) const { BIO_free(bio); }
};
using BioPtr = std::unique_ptr<BIO, BioFree>;

BioPtr readBio(std::string_view text) {
  if (text.size() > static_cast<std::size_t>(std::numeric_limits<int>::max())) {
    fail("input too large");
  }
  BioPtr bio(BIO_new_mem_buf(text.data(), static_cast<int>(text.size())));
  if (!bio) {
    fail("BIO_new_mem_buf");
  }
  return bio;
}

std::string drain(BIO* bio) {
  char* data = nullptr;
  const long len = BIO_get_mem_data(bio, &data);
  return std::string(data, static_cast<std::size_t>(len));
}

void setRandomSerial(X509* cert) {
  // 64 positive bits, never zero: unique enough and valid under strict checks.
  std::array<uint8_t, 8> bytes{};
  if (!tsap::randomBytes(bytes)) {
    fail("RAND_bytes");
  }
  bytes[0] = static_cast<uint8_t>((bytes[0] & 0x7f) | 0x40);
  std::unique_ptr<BIGNUM, decltype(&BN_free)> bn(BN_bin2bn(bytes.data(), bytes.size(), nullptr), &BN_free);
  if (!bn || BN_to_ASN1_INTEGER(bn.get(), X509_get_serialNumber(cert)) == nullptr) {
    fail("serial number");
  }
}

X509_NAME* nameFor(std::string_view commonName) {
  if (commonName.empty()) {
    fail("empty common name");
  }
  X509_NAME* name = X509_NAME_new();
  if (name == nullptr ||
      X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>(commonName.data()),
                                 static_cast<int>(commonName.size()), -1, 0) != 1) {
    X509_NAME_free(name);
    fail("subject name");
  }
  return name;
}

void addExtension(X509* cert, X509* issuer, int nid, const char* value) {
  X509V3_CTX ctx;
  X509V3_set_ctx_nodb(&ctx);
  X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
  X509_EXTENSION* ext = X509V3_EXT_nconf_nid(nullptr, &ctx, nid, value);
  if (ext == nullptr || X509_add_ext(cert, ext, -1) != 1) {
    X509_EXTENSION_free(ext);
    fail("extension");
  }
  X509_EXTENSION_free(ext);
}

// Everything but extensions and signature.
TarvexSAPCert newCertificate(std::string_view commonName, const X509_NAME* issuerName, EVP_PKEY* subjectKey,
                             const TarvexSAPValidity& validity) {
  TarvexSAPCert cert(X509_new());
  if (!cert || X509_set_version(cert.get(), X509_VERSION_3) != 1) {
    fail("X509_new");
  }
  setRandomSerial(cert.get());
  X509_NAME* subject = nameFor(commonName);
  const bool named = X509_set_subject_name(cert.get(), subject) == 1 &&
                     X509_set_issuer_name(cert.get(), issuerName != nullptr ? issuerName : subject) == 1;
  X509_NAME_free(subject);
  // One reading of the clock for both ends, so the validity span is exactly what was asked.
  time_t now = time(nullptr);
  if (!named ||
      X509_time_adj(X509_getm_notBefore(cert.get()), static_cast<long>(validity.notBefore.count()), &now) == nullptr ||
      X509_time_adj(X509_getm_notAfter(cert.get()), static_cast<long>(validity.notAfter.count()), &now) == nullptr ||
      X509_set_pubkey(cert.get(), subjectKey) != 1) {
    fail("certificate fields");
  }
  return cert;
}

TarvexSAPKey takeOrGenerate(EVP_PKEY* key) {
  if (key == nullptr) {
    return TarvexSAPGenerateEd25519Key();
  }
  if (EVP_PKEY_up_ref(key) != 1) {
    fail("EVP_PKEY_up_ref");
  }
  return TarvexSAPKey(key);
}

}  // namespace

TarvexSAPKey TarvexSAPGenerateEd25519Key() {
  TarvexSAPKey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "ED25519"));
  if (!key) {
    fail("Ed25519 key generation");
  }
  return key;
}

TarvexSAPKey TarvexSAPEd25519KeyFromSeed(std::span<const uint8_t, 32> seed) {
  TarvexSAPKey key(EVP_PKEY_new_raw_private_key_ex(nullptr, "ED25519", nullptr, seed.data(), seed.size()));
  if (!key) {
    fail("Ed25519 key from seed");
  }
  return key;
}

TarvexSAPCredential TarvexSAPMakeRoot(std::string_view commonName, const TarvexSAPValidity& validity, EVP_PKEY* key) {
  TarvexSAPCredential root;
  root.key = takeOrGenerate(key);
  root.certificate = newCertificate(commonName, nullptr, root.key.get(), validity);
  X509* cert = root.certificate.get();
  addExtension(cert, cert, NID_basic_constraints, "critical,CA:TRUE");
  addExtension(cert, cert, NID_key_usage, "critical,keyCertSign,cRLSign");
  // The subject key identifier must exist before the authority one can refer to it.
  addExtension(cert, cert, NID_subject_key_identifier, "hash");
  addExtension(cert, cert, NID_authority_key_identifier, "keyid:always");
  if (X509_sign(cert, root.key.get(), nullptr) <= 0) {
    fail("root signature");
  }
  return root;
}

TarvexSAPCredential TarvexSAPIssueSetupCertificate(const TarvexSAPCredential& root, std::string_view commonName,
                                                   const TarvexSAPValidity& validity, EVP_PKEY* subjectKey) {
  if (!root.certificate || !root.key) {
    fail("root credential incomplete");
  }
  TarvexSAPCredential leaf;
  leaf.key = takeOrGenerate(subjectKey);
  leaf.certificate =
      newCertificate(commonName, X509_get_subject_name(root.certificate.get()), leaf.key.get(), validity);
  X509* cert = leaf.certificate.get();
  addExtension(cert, root.certificate.get(), NID_basic_constraints, "critical,CA:FALSE");
  addExtension(cert, root.certificate.get(), NID_key_usage, "critical,digitalSignature");
  addExtension(cert, root.certificate.get(), NID_subject_key_identifier, "hash");
  addExtension(cert, root.certificate.get(), NID_authority_key_identifier, "keyid:always");
  if (X509_sign(cert, root.key.get(), nullptr) <= 0) {
    fail("setup certificate signature");
  }
  return leaf;
}

std::string TarvexSAPCertToPEM(const X509* cert) {
  BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || cert == nullptr || PEM_write_bio_X509(bio.get(), cert) != 1) {
    fail("certificate to PEM");
  }
  return drain(bio.get());
}

std::vector<uint8_t> TarvexSAPCertToDER(const X509* cert) {
  unsigned char* der = nullptr;
  const int len = cert != nullptr ? i2d_X509(cert, &der) : -1;
  if (len <= 0) {
    fail("certificate to DER");
  }
  std::vector<uint8_t> out(der, der + len);
  OPENSSL_free(der);
  return out;
}

TarvexSAPCert TarvexSAPCertFromPEM(std::string_view pem) {
  BioPtr bio = readBio(pem);
  TarvexSAPCert cert(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
  if (!cert) {
    fail("certificate from PEM");
  }
  return cert;
}

TarvexSAPCert TarvexSAPCertFromDER(std::span<const uint8_t> der) {
  const unsigned char* p = der.data();
  TarvexSAPCert cert(der.empty() ? nullptr : d2i_X509(nullptr, &p, static_cast<long>(der.size())));
  if (!cert || p != der.data() + der.size()) {
    fail("certificate from DER");
  }
  return cert;
}

std::string TarvexSAPKeyToPEM(const EVP_PKEY* key) {
  BioPtr bio(BIO_new(BIO_s_mem()));
  if (!bio || key == nullptr || PEM_write_bio_PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    fail("key to PEM");
  }
  return drain(bio.get());
}

std::vector<uint8_t> TarvexSAPKeyToDER(const EVP_PKEY* key) {
  std::unique_ptr<PKCS8_PRIV_KEY_INFO, decltype(&PKCS8_PRIV_KEY_INFO_free)> p8(
      key != nullptr ? EVP_PKEY2PKCS8(key) : nullptr, &PKCS8_PRIV_KEY_INFO_free);
  unsigned char* der = nullptr;
  const int len = p8 ? i2d_PKCS8_PRIV_KEY_INFO(p8.get(), &der) : -1;
  if (len <= 0) {
    fail("key to DER");
  }
  std::vector<uint8_t> out(der, der + len);
  OPENSSL_clear_free(der, static_cast<std::size_t>(len));
  return out;
}

TarvexSAPKey TarvexSAPKeyFromPEM(std::string_view pem) {
  BioPtr bio = readBio(pem);
  TarvexSAPKey key(PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr));
  if (!key) {
    fail("key from PEM");
  }
  return key;
}

TarvexSAPKey TarvexSAPKeyFromDER(std::span<const uint8_t> der) {
  const unsigned char* p = der.data();
  TarvexSAPKey key(der.empty() ? nullptr : d2i_AutoPrivateKey(nullptr, &p, static_cast<long>(der.size())));
  if (!key) {
    fail("key from DER");
  }
  return key;
}
