// The replacement token that activation issues, in two DER pieces:
//   record     SEQUENCE { UTF8String uuid, UTF8String ppid, INTEGER issuedAt (Unix seconds) }
//   signature  OCTET STRING holding the Ed25519 signature of the record's bytes
// Written back to back they are token data again (two DER items), which later requests carry;
// decodeActivationToken() recognises such a token when the signature verifies with `key`.
// Encoding fails, with a text starting "activation token: ", only when the crypto library does.
#pragma once

#include <openssl/evp.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/values/result.h"

namespace devserver {

struct ActivationRecord {
  std::string uuid;
  std::string ppid;
  int64_t issuedAt = 0;
};

// encodeActivationRecord returns the DER record of `record`, or a failure when encoding fails.
platform::Result<std::vector<uint8_t>> encodeActivationRecord(const ActivationRecord& record);
// signActivationRecord returns the DER OCTET STRING of the Ed25519 signature of `recordDER` by
// `key` (which stays the caller's), or a failure when signing or encoding fails.
platform::Result<std::vector<uint8_t>> signActivationRecord(std::span<const uint8_t> recordDER, EVP_PKEY* key);

// The record, if `recordDER` is exactly one such SEQUENCE and `signatureDER` exactly one OCTET
// STRING holding a valid signature of it by `key`.
std::optional<ActivationRecord> decodeActivationToken(std::span<const uint8_t> recordDER,
                                                      std::span<const uint8_t> signatureDER, EVP_PKEY* key);

}  // namespace devserver
