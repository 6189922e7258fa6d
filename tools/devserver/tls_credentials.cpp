#include "devserver/tls_credentials.h"

#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/rand.h>
#include <openssl/x509v3.h>

#include <initializer_list>
#include <memory>
#include <string>

namespace devserver {

namespace {

constexpr long kValidSeconds = 10L * 365 * 24 * 3600;

using platform::Failure;
using platform::Result;

Failure failure(const char* what) {
  ERR_clear_error();
  return Failure{std::string("TLS certificate: ") + what + " failed"};
}

Result<TarvexSAPKey> newP256Key() {
  TarvexSAPKey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
  if (!key) {
    return failure("key generation");
  }
  return key;
}

bool setName(X509_NAME* name, std::string_view commonName) {
  const std::string cn(commonName);
  return X509_NAME_add_entry_by_txt(name, "O", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>("zlka-devserver"),
                                    -1, -1, 0) == 1 &&
         X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>(cn.c_str()), -1,
                                    -1, 0) == 1;
}

// A certificate body with a random serial, the validity window, the subject and its key.
Result<TarvexSAPCert> newCertificate(std::string_view commonName, EVP_PKEY* subjectKey) {
  TarvexSAPCert cert(X509_new());
  if (!cert) {
    return failure("allocation");
  }
  if (X509_set_version(cert.get(), X509_VERSION_3) != 1) {
    return failure("version");
  }
  std::unique_ptr<BIGNUM, decltype(&BN_free)> serial(BN_new(), &BN_free);
  // 127 random bits keep the serial positive and unique across regenerations.
  if (!serial || BN_rand(serial.get(), 127, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1 ||
      BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(cert.get())) == nullptr) {
    return failure("serial number");
  }
  if (X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600) == nullptr ||
      X509_gmtime_adj(X509_getm_notAfter(cert.get()), kValidSeconds) == nullptr) {
    return failure("validity");
  }
  if (!setName(X509_get_subject_name(cert.get()), commonName)) {
    return failure("subject name");
  }
  if (X509_set_pubkey(cert.get(), subjectKey) != 1) {
    return failure("public key");
  }
  return cert;
}

struct Extension {
  int nid;
  const char* value;
};

// A new key and a certificate of it issued by `authority`, or self-signed when that is null.
Result<TarvexSAPCredential> certify(std::string_view commonName, const TarvexSAPCredential* authority,
                                    std::initializer_list<Extension> extensions) {
  Result<TarvexSAPKey> key = newP256Key();
  if (!key) {
    return Failure{key.error()};
  }
  Result<TarvexSAPCert> made = newCertificate(commonName, key->get());
  if (!made) {
    return Failure{made.error()};
  }
  X509* cert = made->get();
  X509* issuer = authority != nullptr ? authority->certificate.get() : cert;
  if (X509_set_issuer_name(cert, X509_get_subject_name(issuer)) != 1) {
    return failure("issuer name");
  }
  X509V3_CTX ctx;
  X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
  for (const Extension& extension : extensions) {
    X509_EXTENSION* encoded = X509V3_EXT_conf_nid(nullptr, &ctx, extension.nid, extension.value);
    const bool added = encoded != nullptr && X509_add_ext(cert, encoded, -1) == 1;
    X509_EXTENSION_free(encoded);
    if (!added) {
      return failure("extension");
    }
  }
  if (X509_sign(cert, authority != nullptr ? authority->key.get() : key->get(), EVP_sha256()) <= 0) {
    return failure("signing");
  }
  TarvexSAPCert certificate = *std::move(made);
  return TarvexSAPCredential{std::move(certificate), *std::move(key)};
}

}  // namespace

Result<TarvexSAPCredential> makeTLSAuthority(std::string_view commonName) {
  return certify(commonName, nullptr,
                 {{NID_basic_constraints, "critical,CA:TRUE"},
                  {NID_key_usage, "critical,keyCertSign,cRLSign"},
                  {NID_subject_key_identifier, "hash"},
                  {NID_authority_key_identifier, "keyid:always"}});
}

Result<TarvexSAPCredential> issueTLSServerCertificate(const TarvexSAPCredential& authority,
                                                      std::string_view commonName) {
  return certify(commonName, &authority,
                 {{NID_basic_constraints, "critical,CA:FALSE"},
                  {NID_key_usage, "critical,digitalSignature"},
                  {NID_ext_key_usage, "serverAuth"},
                  {NID_subject_alt_name, "IP:127.0.0.1,IP:::1,DNS:localhost"},
                  {NID_subject_key_identifier, "hash"},
                  {NID_authority_key_identifier, "keyid:always"}});
}

bool issuedBy(X509* cert, const TarvexSAPCredential& authority) {
  EVP_PKEY* authorityKey = X509_get0_pubkey(authority.certificate.get());
  const bool ok = authorityKey != nullptr && X509_check_issued(authority.certificate.get(), cert) == X509_V_OK &&
                  X509_verify(cert, authorityKey) == 1;
  ERR_clear_error();
  return ok;
}

}  // namespace devserver
