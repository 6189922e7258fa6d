#include "devserver/tls_credentials.h"

#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/rand.h>
#include <openssl/x509v3.h>

#include <memory>
#include <stdexcept>
#include <string>

namespace devserver {

namespace {

constexpr long kValidSeconds = 10L * 365 * 24 * 3600;

[[noreturn]] void fail(const char* what) {
  ERR_clear_error();
  throw std::runtime_error(std::string("TLS certificate: ") + what + " failed");
}

void check(int ok, const char* what) {
  if (ok != 1) {
    fail(what);
  }
}

TarvexSAPKey newP256Key() {
  TarvexSAPKey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
  if (!key) {
    fail("key generation");
  }
  return key;
}

void setName(X509_NAME* name, std::string_view commonName) {
  const std::string cn(commonName);
  check(X509_NAME_add_entry_by_txt(name, "O", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>("zlka-devserver"),
                                   -1, -1, 0),
        "subject name");
  check(X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>(cn.c_str()), -1,
                                   -1, 0),
        "subject name");
}

void addExtension(X509* cert, X509V3_CTX* ctx, int nid, const char* value) {
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, ctx, nid, value);
  if (extension == nullptr) {
    fail("extension");
  }
  const int ok = X509_add_ext(cert, extension, -1);
  X509_EXTENSION_free(extension);
  check(ok, "extension");
}

// A certificate body with a random serial, the validity window, the subject and its key.
TarvexSAPCert newCertificate(std::string_view commonName, EVP_PKEY* subjectKey) {
  TarvexSAPCert cert(X509_new());
  if (!cert) {
    fail("allocation");
  }
  check(X509_set_version(cert.get(), X509_VERSION_3), "version");
  std::unique_ptr<BIGNUM, decltype(&BN_free)> serial(BN_new(), &BN_free);
  // 127 random bits keep the serial positive and unique across regenerations.
  if (!serial || BN_rand(serial.get(), 127, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1 ||
      BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(cert.get())) == nullptr) {
    fail("serial number");
  }
  if (X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600) == nullptr ||
      X509_gmtime_adj(X509_getm_notAfter(cert.get()), kValidSeconds) == nullptr) {
    fail("validity");
  }
  setName(X509_get_subject_name(cert.get()), commonName);
  check(X509_set_pubkey(cert.get(), subjectKey), "public key");
  return cert;
}

}  // namespace

TarvexSAPCredential makeTLSAuthority(std::string_view commonName) {
  TarvexSAPKey key = newP256Key();
  TarvexSAPCert cert = newCertificate(commonName, key.get());
  check(X509_set_issuer_name(cert.get(), X509_get_subject_name(cert.get())), "issuer name");
  X509V3_CTX ctx;
  X509V3_set_ctx(&ctx, cert.get(), cert.get(), nullptr, nullptr, 0);
  addExtension(cert.get(), &ctx, NID_basic_constraints, "critical,CA:TRUE");
  addExtension(cert.get(), &ctx, NID_key_usage, "critical,keyCertSign,cRLSign");
  addExtension(cert.get(), &ctx, NID_subject_key_identifier, "hash");
  addExtension(cert.get(), &ctx, NID_authority_key_identifier, "keyid:always");
  if (X509_sign(cert.get(), key.get(), EVP_sha256()) <= 0) {
    fail("signing");
  }
  return TarvexSAPCredential{std::move(cert), std::move(key)};
}

TarvexSAPCredential issueTLSServerCertificate(const TarvexSAPCredential& authority, std::string_view commonName) {
  TarvexSAPKey key = newP256Key();
  TarvexSAPCert cert = newCertificate(commonName, key.get());
  check(X509_set_issuer_name(cert.get(), X509_get_subject_name(authority.certificate.get())), "issuer name");
  X509V3_CTX ctx;
  X509V3_set_ctx(&ctx, authority.certificate.get(), cert.get(), nullptr, nullptr, 0);
  addExtension(cert.get(), &ctx, NID_basic_constraints, "critical,CA:FALSE");
  addExtension(cert.get(), &ctx, NID_key_usage, "critical,digitalSignature");
  addExtension(cert.get(), &ctx, NID_ext_key_usage, "serverAuth");
  addExtension(cert.get(), &ctx, NID_subject_alt_name, "IP:127.0.0.1,IP:::1,DNS:localhost");
  addExtension(cert.get(), &ctx, NID_subject_key_identifier, "hash");
  addExtension(cert.get(), &ctx, NID_authority_key_identifier, "keyid:always");
  if (X509_sign(cert.get(), authority.key.get(), EVP_sha256()) <= 0) {
    fail("signing");
  }
  return TarvexSAPCredential{std::move(cert), std::move(key)};
}

bool issuedBy(X509* cert, const TarvexSAPCredential& authority) {
  EVP_PKEY* authorityKey = X509_get0_pubkey(authority.certificate.get());
  const bool ok = authorityKey != nullptr && X509_check_issued(authority.certificate.get(), cert) == X509_V_OK &&
                  X509_verify(cert, authorityKey) == 1;
  ERR_clear_error();
  return ok;
}

}  // namespace devserver
