// The TSAP1 computations both sides must agree on: the transcript hash T, the HKDF split into
// request and response keys, and the 40-byte message signatures. Internal to the library.
#pragma once

#include "tarvexsap/tsap_crypto.h"
#include "tarvexsap/tsap_wire.h"

namespace tsap {

struct SessionKeys {
  Secret<kKeySize> request;
  Secret<kKeySize> response;
  // clear erases both keys.
  void clear() {
    request.clear();
    response.clear();
  }
};

enum class Direction { request, response };

// T = SHA-256("TSAP1 transcript" || request || first 65 bytes of the session info).
bool transcriptHash(const RequestBytes& request, const SessionInfoBytes& info, Digest& t);

// HKDF-SHA256(IKM z, salt clientNonce || serverNonce, info "TSAP1 keys" || T), 64 bytes.
bool deriveSessionKeys(const Secret<32>& z, std::span<const uint8_t, kNonceSize> clientNonce,
                       std::span<const uint8_t, kNonceSize> serverNonce, const Digest& t, SessionKeys& keys);

// seq (8 bytes BE) || HMAC-SHA256(key, label || seq || data), label by direction.
bool signMessage(const SessionKeys& keys, Direction direction, uint64_t seq, Bytes data, SignatureBytes& out);

// Checks the MAC of a 40-byte signature in constant time; writes its seq. Says nothing about
// replay, which each side judges on its own.
bool checkMessage(const SessionKeys& keys, Direction direction, Bytes signature, Bytes data, uint64_t& seq);

}  // namespace tsap
