#include "devserver/activation_token.h"

#include <openssl/asn1.h>
#include <openssl/err.h>

#include <climits>
#include <memory>

namespace devserver {

namespace {

struct SequenceFree {
  void operator()(ASN1_SEQUENCE_ANY* sequence) const { sk_ASN1_TYPE_pop_free(sequence, ASN1_TYPE_free); }
};
struct OctetStringFree {
  void operator()(ASN1_OCTET_STRING* string) const { ASN1_OCTET_STRING_free(string); }
};
struct DigestContextFree {
  void operator()(EVP_MD_CTX* ctx) const { EVP_MD_CTX_free(ctx); }
};
using Sequence = std::unique_ptr<ASN1_SEQUENCE_ANY, SequenceFree>;

using platform::Failure;
using platform::Result;

Failure failure(const char* what) {
  ERR_clear_error();
  return Failure{std::string("activation token: ") + what + " failed"};
}

// Appends `value` (of ASN.1 `type`), which the sequence then owns; on failure it is freed with `release`.
template <typename Value>
bool push(ASN1_SEQUENCE_ANY* sequence, int type, Value* value, void (*release)(Value*)) {
  ASN1_TYPE* item = ASN1_TYPE_new();
  if (item == nullptr) {
    release(value);
    return false;
  }
  ASN1_TYPE_set(item, type, value);  // takes `value`
  if (sk_ASN1_TYPE_push(sequence, item) <= 0) {
    ASN1_TYPE_free(item);
    return false;
  }
  return true;
}

ASN1_UTF8STRING* utf8String(std::string_view text) {
  ASN1_UTF8STRING* string = ASN1_UTF8STRING_new();
  if (string == nullptr || ASN1_STRING_set(string, text.data(), static_cast<int>(text.size())) != 1) {
    ASN1_UTF8STRING_free(string);
    return nullptr;
  }
  return string;
}

ASN1_INTEGER* integer(int64_t value) {
  ASN1_INTEGER* number = ASN1_INTEGER_new();
  if (number == nullptr || ASN1_INTEGER_set_int64(number, value) != 1) {
    ASN1_INTEGER_free(number);
    return nullptr;
  }
  return number;
}

template <typename Encode>
Result<std::vector<uint8_t>> encode(Encode encodeTo) {
  unsigned char* der = nullptr;
  const int length = encodeTo(&der);
  if (length <= 0 || der == nullptr) {
    return failure("DER encoding");
  }
  std::vector<uint8_t> out(der, der + length);
  OPENSSL_free(der);
  return out;
}

std::string stringOf(const ASN1_STRING* string) {
  return std::string(reinterpret_cast<const char*>(ASN1_STRING_get0_data(string)),
                     static_cast<std::size_t>(ASN1_STRING_length(string)));
}

}  // namespace

Result<std::vector<uint8_t>> encodeActivationRecord(const ActivationRecord& record) {
  Sequence sequence(sk_ASN1_TYPE_new_null());
  if (!sequence) {
    return failure("allocation");
  }
  for (const std::string* text : {&record.uuid, &record.ppid}) {
    if (text->size() > static_cast<std::size_t>(INT_MAX)) {
      return failure("string length");
    }
    ASN1_UTF8STRING* string = utf8String(*text);
    if (string == nullptr) {
      return failure("string encoding");
    }
    if (!push(sequence.get(), V_ASN1_UTF8STRING, string, ASN1_UTF8STRING_free)) {
      return failure("allocation");
    }
  }
  ASN1_INTEGER* issuedAt = integer(record.issuedAt);
  if (issuedAt == nullptr) {
    return failure("integer encoding");
  }
  if (!push(sequence.get(), V_ASN1_INTEGER, issuedAt, ASN1_INTEGER_free)) {
    return failure("allocation");
  }
  return encode([&](unsigned char** der) { return i2d_ASN1_SEQUENCE_ANY(sequence.get(), der); });
}

Result<std::vector<uint8_t>> signActivationRecord(std::span<const uint8_t> recordDER, EVP_PKEY* key) {
  std::unique_ptr<EVP_MD_CTX, DigestContextFree> ctx(EVP_MD_CTX_new());
  unsigned char signature[64];
  std::size_t length = sizeof signature;
  if (!ctx || EVP_DigestSignInit(ctx.get(), nullptr, nullptr, nullptr, key) != 1 ||
      EVP_DigestSign(ctx.get(), signature, &length, recordDER.data(), recordDER.size()) != 1) {
    return failure("Ed25519 signing");
  }
  std::unique_ptr<ASN1_OCTET_STRING, OctetStringFree> octets(ASN1_OCTET_STRING_new());
  if (!octets || ASN1_OCTET_STRING_set(octets.get(), signature, static_cast<int>(length)) != 1) {
    return failure("allocation");
  }
  return encode([&](unsigned char** der) { return i2d_ASN1_OCTET_STRING(octets.get(), der); });
}

std::optional<ActivationRecord> decodeActivationToken(std::span<const uint8_t> recordDER,
                                                      std::span<const uint8_t> signatureDER, EVP_PKEY* key) {
  if (recordDER.size() > static_cast<std::size_t>(LONG_MAX) ||
      signatureDER.size() > static_cast<std::size_t>(LONG_MAX)) {
    return std::nullopt;
  }
  const unsigned char* p = recordDER.data();
  Sequence sequence(d2i_ASN1_SEQUENCE_ANY(nullptr, &p, static_cast<long>(recordDER.size())));
  const unsigned char* q = signatureDER.data();
  std::unique_ptr<ASN1_OCTET_STRING, OctetStringFree> signature(
      d2i_ASN1_OCTET_STRING(nullptr, &q, static_cast<long>(signatureDER.size())));
  ERR_clear_error();
  if (!sequence || p != recordDER.data() + recordDER.size() || !signature ||
      q != signatureDER.data() + signatureDER.size() || sk_ASN1_TYPE_num(sequence.get()) != 3) {
    return std::nullopt;
  }
  const ASN1_TYPE* uuid = sk_ASN1_TYPE_value(sequence.get(), 0);
  const ASN1_TYPE* ppid = sk_ASN1_TYPE_value(sequence.get(), 1);
  const ASN1_TYPE* issuedAt = sk_ASN1_TYPE_value(sequence.get(), 2);
  if (ASN1_TYPE_get(uuid) != V_ASN1_UTF8STRING || ASN1_TYPE_get(ppid) != V_ASN1_UTF8STRING ||
      ASN1_TYPE_get(issuedAt) != V_ASN1_INTEGER) {
    return std::nullopt;
  }
  ActivationRecord record;
  record.uuid = stringOf(uuid->value.utf8string);
  record.ppid = stringOf(ppid->value.utf8string);
  if (ASN1_INTEGER_get_int64(&record.issuedAt, issuedAt->value.integer) != 1) {
    ERR_clear_error();
    return std::nullopt;
  }
  std::unique_ptr<EVP_MD_CTX, DigestContextFree> ctx(EVP_MD_CTX_new());
  const bool valid = ctx && EVP_DigestVerifyInit(ctx.get(), nullptr, nullptr, nullptr, key) == 1 &&
                     EVP_DigestVerify(ctx.get(), ASN1_STRING_get0_data(signature.get()),
                                      static_cast<std::size_t>(ASN1_STRING_length(signature.get())), recordDER.data(),
                                      recordDER.size()) == 1;
  ERR_clear_error();
  if (!valid) {
    return std::nullopt;
  }
  return record;
}

}  // namespace devserver
