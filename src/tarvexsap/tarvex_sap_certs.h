// Certificate tooling for TSAP1 deployments and tests: an Ed25519 SAP root (self-signed X.509 v3
// CA: basicConstraints CA:TRUE critical, keyUsage keyCertSign+cRLSign, SKI/AKI) and setup
// certificates issued by it (not a CA, keyUsage digitalSignature, SKI/AKI), plus PEM/DER
// conversion of certificates and private keys.
// Validity is given as offsets from now, so expired or not-yet-valid certificates can be made.
// Keys may be supplied (fixed keys give reproducible chains; a non-Ed25519 subject key makes a
// deliberately unfit setup certificate); otherwise a fresh Ed25519 key is generated.
// Every function returns a failure, its text starting "SAP certificate tooling: ", when OpenSSL
// fails or input does not parse.
#pragma once

#include <openssl/evp.h>
#include <openssl/x509.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/values/result.h"

// The deleters of the owning types below.
struct TarvexSAPKeyFree {
  // Frees the key (EVP_PKEY_free).
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
struct TarvexSAPCertFree {
  // Frees the certificate (X509_free).
  void operator()(X509* cert) const { X509_free(cert); }
};
using TarvexSAPKey = std::unique_ptr<EVP_PKEY, TarvexSAPKeyFree>;
using TarvexSAPCert = std::unique_ptr<X509, TarvexSAPCertFree>;

struct TarvexSAPValidity {
  std::chrono::seconds notBefore{-3600};                             // from now
  std::chrono::seconds notAfter{std::chrono::hours(24 * 365 * 10)};  // from now
};

// A certificate with its private key (null when the subject key was supplied as public only).
struct TarvexSAPCredential {
  TarvexSAPCert certificate;
  TarvexSAPKey key;
};

// TarvexSAPGenerateEd25519Key returns a fresh Ed25519 key, owned by the caller.
platform::Result<TarvexSAPKey> TarvexSAPGenerateEd25519Key();
// TarvexSAPEd25519KeyFromSeed returns the Ed25519 key of 32 raw private bytes, owned by the
// caller: a fixed seed gives a fixed key.
platform::Result<TarvexSAPKey> TarvexSAPEd25519KeyFromSeed(std::span<const uint8_t, 32> seed);

// TarvexSAPMakeRoot returns a self-signed root named `commonName` (which must not be empty).
// `key` null: a fresh Ed25519 key; otherwise the root takes a reference to it.
platform::Result<TarvexSAPCredential> TarvexSAPMakeRoot(std::string_view commonName,
                                                        const TarvexSAPValidity& validity = {},
                                                        EVP_PKEY* key = nullptr);
// TarvexSAPIssueSetupCertificate returns a setup certificate issued by `root`, which must hold
// its key. `subjectKey` null: a fresh Ed25519 key; otherwise its public half is certified and the
// credential takes a reference to it.
platform::Result<TarvexSAPCredential> TarvexSAPIssueSetupCertificate(const TarvexSAPCredential& root,
                                                                     std::string_view commonName,
                                                                     const TarvexSAPValidity& validity = {},
                                                                     EVP_PKEY* subjectKey = nullptr);

// TarvexSAPCertToPEM and TarvexSAPCertToDER encode `cert`, which stays the caller's.
platform::Result<std::string> TarvexSAPCertToPEM(const X509* cert);
platform::Result<std::vector<uint8_t>> TarvexSAPCertToDER(const X509* cert);
// TarvexSAPCertFromPEM and TarvexSAPCertFromDER decode one certificate (the first of a PEM text;
// the whole of the DER bytes), owned by the caller.
platform::Result<TarvexSAPCert> TarvexSAPCertFromPEM(std::string_view pem);
platform::Result<TarvexSAPCert> TarvexSAPCertFromDER(std::span<const uint8_t> der);

// TarvexSAPKeyToPEM and TarvexSAPKeyToDER encode `key` as unencrypted PKCS#8; it stays the caller's.
platform::Result<std::string> TarvexSAPKeyToPEM(const EVP_PKEY* key);
platform::Result<std::vector<uint8_t>> TarvexSAPKeyToDER(const EVP_PKEY* key);
// TarvexSAPKeyFromPEM and TarvexSAPKeyFromDER decode an unencrypted private key, owned by the caller.
platform::Result<TarvexSAPKey> TarvexSAPKeyFromPEM(std::string_view pem);
platform::Result<TarvexSAPKey> TarvexSAPKeyFromDER(std::span<const uint8_t> der);
