// Thin wrappers over the OpenSSL 3 EVP primitives the association needs: SHA-256, HMAC-SHA256,
// HKDF-SHA256, X25519, Ed25519, randomness and constant-time comparison. Every function reports
// failure by returning false (or null); none throws. Internal to the library.
#pragma once

#include <openssl/evp.h>
#include <openssl/x509.h>

#include <array>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <span>

#include "tarvexsap/tsap_secret.h"

namespace tsap {

// The deleters of the owning types below.
struct PKeyFree {
  // Frees the key (EVP_PKEY_free).
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
struct X509Free {
  // Frees the certificate (X509_free).
  void operator()(X509* cert) const { X509_free(cert); }
};
using PKeyPtr = std::unique_ptr<EVP_PKEY, PKeyFree>;
using X509Ptr = std::unique_ptr<X509, X509Free>;

using Bytes = std::span<const uint8_t>;
using Digest = std::array<uint8_t, 32>;

// randomBytes fills `out` from OpenSSL's generator.
bool randomBytes(std::span<uint8_t> out);
// sha256 writes the digest of the concatenated `parts`.
bool sha256(std::initializer_list<Bytes> parts, Digest& out);
// hmacSha256 writes HMAC-SHA256 under `key` of the concatenated `parts`.
bool hmacSha256(Bytes key, std::initializer_list<Bytes> parts, Digest& out);
// hkdfSha256 fills `out` with HKDF-SHA256 (extract and expand) of `ikm`, `salt` and `info`.
bool hkdfSha256(Bytes ikm, Bytes salt, Bytes info, std::span<uint8_t> out);

// Generates an X25519 key pair and writes its raw public key.
PKeyPtr x25519Generate(std::span<uint8_t, 32> publicKey);
// Shared secret with a raw peer public key; false when derivation fails or the result is all
// zero (a low-order peer point).
bool x25519Derive(EVP_PKEY* privateKey, std::span<const uint8_t, 32> peerPublic, Secret<32>& shared);

// ed25519Sign writes the signature of `message` under `privateKey`.
bool ed25519Sign(EVP_PKEY* privateKey, Bytes message, std::span<uint8_t, 64> signature);
// ed25519Verify is true only when `signature` is `publicKey`'s valid signature of `message`.
bool ed25519Verify(EVP_PKEY* publicKey, Bytes message, std::span<const uint8_t, 64> signature);

// equalConstantTime is true when `a` and `b` hold the same bytes, in time that depends only on
// their length (a difference in length answers false at once).
bool equalConstantTime(Bytes a, Bytes b);

// Wraps caller bytes that may be a null pointer when the length is zero.
inline Bytes bytesOf(const uint8_t* data, std::size_t len) { return len == 0 ? Bytes() : Bytes(data, len); }

}  // namespace tsap
