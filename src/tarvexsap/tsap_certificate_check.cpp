#include "tarvexsap/tsap_certificate_check.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <algorithm>
#include <limits>
#include <string_view>

namespace tsap {
namespace {

// Far above any real certificate; bounds parser work on hostile input.
constexpr std::size_t kMaxCertificateSize = 64 * 1024;
constexpr std::string_view kPEMPrefix = "-----BEGIN";

struct StoreCtxFree {
  void operator()(X509_STORE_CTX* ctx) const { X509_STORE_CTX_free(ctx); }
};
struct BioFree {
  void operator()(BIO* bio) const { BIO_free(bio); }
};

X509Ptr parseCertificate(Bytes bytes) {
  if (bytes.size() >= kPEMPrefix.size() && std::equal(kPEMPrefix.begin(), kPEMPrefix.end(), bytes.begin())) {
    std::unique_ptr<BIO, BioFree> bio(BIO_new_mem_buf(bytes.data(), static_cast<int>(bytes.size())));
    return X509Ptr(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
  }
  const unsigned char* p = bytes.data();
  X509Ptr cert(d2i_X509(nullptr, &p, static_cast<long>(bytes.size())));
  // Trailing bytes after the certificate mean the input is not what it claims to be.
  if (cert && p != bytes.data() + bytes.size()) {
    return nullptr;
  }
  return cert;
}

bool chainsToAnchor(const DeviceConfig& config, X509* leaf) {
  std::unique_ptr<X509_STORE_CTX, StoreCtxFree> ctx(X509_STORE_CTX_new());
  if (!ctx || X509_STORE_CTX_init(ctx.get(), config.trustStore.get(), leaf, nullptr) != 1) {
    return false;
  }
  X509_VERIFY_PARAM_set_flags(X509_STORE_CTX_get0_param(ctx.get()), X509_V_FLAG_X509_STRICT);
  return X509_verify_cert(ctx.get()) == 1;
}

bool fitForSetup(X509* leaf) {
  EVP_PKEY* key = X509_get0_pubkey(leaf);
  if (key == nullptr || EVP_PKEY_get_base_id(key) != EVP_PKEY_ED25519) {
    return false;
  }
  // The root itself is a valid chain of one; being a CA is what rules it out.
  if (X509_check_ca(leaf) != 0) {
    return false;
  }
  const uint32_t flags = X509_get_extension_flags(leaf);
  return (flags & EXFLAG_KUSAGE) != 0 && (X509_get_key_usage(leaf) & KU_DIGITAL_SIGNATURE) != 0;
}

}  // namespace

int32_t acceptSetupCertificate(const DeviceConfig& config, Bytes certificate, PKeyPtr& publicKey) {
  if (certificate.empty() || certificate.size() > kMaxCertificateSize) {
    return kTarvexSAPErrorCertificateRejected;
  }
  X509Ptr leaf = parseCertificate(certificate);
  const bool accepted = leaf && chainsToAnchor(config, leaf.get()) && fitForSetup(leaf.get());
  // Leave nothing of a rejected certificate in this thread's error queue.
  ERR_clear_error();
  if (!accepted) {
    return kTarvexSAPErrorCertificateRejected;
  }
  publicKey.reset(X509_get_pubkey(leaf.get()));
  return publicKey ? kTarvexSAPOK : kTarvexSAPErrorCryptoFailure;
}

}  // namespace tsap
