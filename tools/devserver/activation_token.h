// The replacement token that activation issues, in two DER pieces:
//   record     SEQUENCE { UTF8String uuid, UTF8String ppid, INTEGER issuedAt (Unix seconds) }
//   signature  OCTET STRING holding the Ed25519 signature of the record's bytes
// Written back to back they are token data again (two DER items), which later requests carry;
// decodeActivationToken() recognises such a token when the signature verifies with `key`.
// Encoding failures of the crypto library throw std::runtime_error.
#pragma once

#include <openssl/evp.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace devserver {

struct ActivationRecord {
  std::string uuid;
  std::string ppid;
  int64_t issuedAt = 0;
};

std::vector<uint8_t> encodeActivationRecord(const ActivationRecord& record);
std::vector<uint8_t> signActivationRecord(std::span<const uint8_t> recordDER, EVP_PKEY* key);

// The record, if `recordDER` is exactly one such SEQUENCE and `signatureDER` exactly one OCTET
// STRING holding a valid signature of it by `key`.
std::optional<ActivationRecord> decodeActivationToken(std::span<const uint8_t> recordDER,
                                                      std::span<const uint8_t> signatureDER, EVP_PKEY* key);

}  // namespace devserver
