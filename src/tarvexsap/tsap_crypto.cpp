#include "tarvexsap/tsap_crypto.h"

#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/kdf.h>
#include <openssl/params.h>
#include <openssl/rand.h>

#include <limits>

namespace tsap {
namespace {

// Algorithm objects are fetched once and kept for the life of the process: fetching is the
// expensive part of every MAC and digest, and the objects are immutable and thread-safe.
const EVP_MD* sha256Method() {
  static EVP_MD* const md = EVP_MD_fetch(nullptr, "SHA256", nullptr);
  return md;
}

EVP_MAC* hmacMethod() {
  static EVP_MAC* const mac = EVP_MAC_fetch(nullptr, "HMAC", nullptr);
  return mac;
}

EVP_KDF* hkdfMethod() {
  static EVP_KDF* const kdf = EVP_KDF_fetch(nullptr, "HKDF", nullptr);
  return kdf;
}

struct MdCtxFree {
  void operator()(EVP_MD_CTX* ctx) const { EVP_MD_CTX_free(ctx); }
};
struct MacCtxFree {
  void operator()(EVP_MAC_CTX* ctx) const { EVP_MAC_CTX_free(ctx); }
};
struct KdfCtxFree {
  void operator()(EVP_KDF_CTX* ctx) const { EVP_KDF_CTX_free(ctx); }
};
struct PKeyCtxFree {
  void operator()(EVP_PKEY_CTX* ctx) const { EVP_PKEY_CTX_free(ctx); }
};

char sha256Name[] = "SHA256";

}  // namespace

bool randomBytes(std::span<uint8_t> out) {
  if (out.size() > static_cast<std::size_t>(std::numeric_limits<int>::max())) {
    return false;
  }
  return out.empty() || RAND_bytes(out.data(), static_cast<int>(out.size())) == 1;
}

bool sha256(std::initializer_list<Bytes> parts, Digest& out) {
  const EVP_MD* md = sha256Method();
  std::unique_ptr<EVP_MD_CTX, MdCtxFree> ctx(EVP_MD_CTX_new());
  if (md == nullptr || !ctx || EVP_DigestInit_ex2(ctx.get(), md, nullptr) != 1) {
    return false;
  }
  for (Bytes part : parts) {
    if (!part.empty() && EVP_DigestUpdate(ctx.get(), part.data(), part.size()) != 1) {
      return false;
    }
  }
  unsigned int len = 0;
  return EVP_DigestFinal_ex(ctx.get(), out.data(), &len) == 1 && len == out.size();
}

bool hmacSha256(Bytes key, std::initializer_list<Bytes> parts, Digest& out) {
  EVP_MAC* mac = hmacMethod();
  if (mac == nullptr || key.empty()) {
    return false;
  }
  std::unique_ptr<EVP_MAC_CTX, MacCtxFree> ctx(EVP_MAC_CTX_new(mac));
  OSSL_PARAM params[] = {
      OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, sha256Name, 0),
      OSSL_PARAM_construct_end(),
  };
  if (!ctx || EVP_MAC_init(ctx.get(), key.data(), key.size(), params) != 1) {
    return false;
  }
  for (Bytes part : parts) {
    if (!part.empty() && EVP_MAC_update(ctx.get(), part.data(), part.size()) != 1) {
      return false;
    }
  }
  std::size_t len = 0;
  return EVP_MAC_final(ctx.get(), out.data(), &len, out.size()) == 1 && len == out.size();
}

bool hkdfSha256(Bytes ikm, Bytes salt, Bytes info, std::span<uint8_t> out) {
  EVP_KDF* kdf = hkdfMethod();
  if (kdf == nullptr || ikm.empty()) {
    return false;
  }
  std::unique_ptr<EVP_KDF_CTX, KdfCtxFree> ctx(EVP_KDF_CTX_new(kdf));
  if (!ctx) {
    return false;
  }
  // OSSL_PARAM wants non-const pointers; OpenSSL only reads them.
  OSSL_PARAM params[] = {
      OSSL_PARAM_construct_utf8_string(OSSL_KDF_PARAM_DIGEST, sha256Name, 0),
      OSSL_PARAM_construct_octet_string(OSSL_KDF_PARAM_KEY, const_cast<uint8_t*>(ikm.data()), ikm.size()),
      OSSL_PARAM_construct_octet_string(OSSL_KDF_PARAM_SALT, const_cast<uint8_t*>(salt.data()), salt.size()),
      OSSL_PARAM_construct_octet_string(OSSL_KDF_PARAM_INFO, const_cast<uint8_t*>(info.data()), info.size()),
      OSSL_PARAM_construct_end(),
  };
  return EVP_KDF_derive(ctx.get(), out.data(), out.size(), params) == 1;
}

PKeyPtr x25519Generate(std::span<uint8_t, 32> publicKey) {
  PKeyPtr key(EVP_PKEY_Q_keygen(nullptr, nullptr, "X25519"));
  std::size_t len = publicKey.size();
  if (!key || EVP_PKEY_get_raw_public_key(key.get(), publicKey.data(), &len) != 1 || len != publicKey.size()) {
    return nullptr;
  }
  return key;
}

bool x25519Derive(EVP_PKEY* privateKey, std::span<const uint8_t, 32> peerPublic, Secret<32>& shared) {
  PKeyPtr peer(EVP_PKEY_new_raw_public_key_ex(nullptr, "X25519", nullptr, peerPublic.data(), peerPublic.size()));
  if (!peer || privateKey == nullptr) {
    return false;
  }
  std::unique_ptr<EVP_PKEY_CTX, PKeyCtxFree> ctx(EVP_PKEY_CTX_new_from_pkey(nullptr, privateKey, nullptr));
  std::size_t len = shared.size();
  if (!ctx || EVP_PKEY_derive_init(ctx.get()) != 1 || EVP_PKEY_derive_set_peer(ctx.get(), peer.get()) != 1 ||
      EVP_PKEY_derive(ctx.get(), shared.data(), &len) != 1 || len != shared.size()) {
    shared.clear();
    return false;
  }
  // A low-order peer point yields an all-zero secret that an attacker can predict.
  static const std::array<uint8_t, 32> zero{};
  if (CRYPTO_memcmp(shared.data(), zero.data(), zero.size()) == 0) {
    return false;
  }
  return true;
}

bool ed25519Sign(EVP_PKEY* privateKey, Bytes message, std::span<uint8_t, 64> signature) {
  std::unique_ptr<EVP_MD_CTX, MdCtxFree> ctx(EVP_MD_CTX_new());
  std::size_t len = signature.size();
  return ctx && privateKey != nullptr &&
         EVP_DigestSignInit_ex(ctx.get(), nullptr, nullptr, nullptr, nullptr, privateKey, nullptr) == 1 &&
         EVP_DigestSign(ctx.get(), signature.data(), &len, message.data(), message.size()) == 1 &&
         len == signature.size();
}

bool ed25519Verify(EVP_PKEY* publicKey, Bytes message, std::span<const uint8_t, 64> signature) {
  if (publicKey == nullptr || EVP_PKEY_get_base_id(publicKey) != EVP_PKEY_ED25519) {
    return false;
  }
  std::unique_ptr<EVP_MD_CTX, MdCtxFree> ctx(EVP_MD_CTX_new());
  return ctx && EVP_DigestVerifyInit_ex(ctx.get(), nullptr, nullptr, nullptr, nullptr, publicKey, nullptr) == 1 &&
         EVP_DigestVerify(ctx.get(), signature.data(), signature.size(), message.data(), message.size()) == 1;
}

bool equalConstantTime(Bytes a, Bytes b) {
  return a.size() == b.size() && CRYPTO_memcmp(a.data(), b.data(), a.size()) == 0;
}

}  // namespace tsap
