// An independent, deliberately plain rendering of the TSAP1 computations, written from the wire
// layout with other OpenSSL entry points than the library uses (one-shot digest and MAC, HKDF
// through EVP_PKEY_derive). Tests use it to play either side by hand, so device and server are
// each checked against the layout, not only against each other.
#pragma once

#include "tsap_test_support.h"

#include <initializer_list>
#include <string_view>

namespace tsapref {

using tsaptest::Bytes;

Bytes cat(std::initializer_list<Bytes> parts);
Bytes label(std::string_view text);
Bytes be64(uint64_t value);
Bytes sha256(const Bytes &data);
Bytes hmacSha256(const Bytes &key, const Bytes &data);
Bytes hkdfSha256(const Bytes &ikm, const Bytes &salt, const Bytes &info, std::size_t length);

struct X25519Pair {
    TarvexSAPKey key;
    Bytes publicKey;
};
X25519Pair x25519();
// Empty when OpenSSL refuses the derivation.
Bytes x25519Shared(EVP_PKEY *privateKey, const Bytes &peerPublic);
Bytes ed25519Sign(EVP_PKEY *key, const Bytes &message);
bool ed25519Verify(EVP_PKEY *key, const Bytes &message, const Bytes &signature);

struct Keys {
    Bytes request;
    Bytes response;
};

// T and the two keys from the two handshake messages and the shared secret.
Bytes transcript(const Bytes &request, const Bytes &sessionInfo);
Keys keys(const Bytes &z, const Bytes &request, const Bytes &sessionInfo);

// seq || HMAC(key, label || seq || data)
Bytes messageSignature(const Bytes &key, std::string_view labelText, uint64_t seq, const Bytes &data);

// The server half by hand: answers a device's 90-byte request with a session info signed by
// `signer`. `serverPublic` replaces the real ephemeral key in the message when given (the keys
// are then not derivable and left empty).
struct HandServer {
    Bytes sessionInfo;
    Keys keys;
};
HandServer handServer(const Bytes &request, EVP_PKEY *signer, uint8_t version = 1,
                      const Bytes *serverPublic = nullptr);

// The device half by hand: a handshake request and the private key behind it.
struct HandDevice {
    Bytes request;
    X25519Pair ephemeral;
    Bytes nonce;
};
HandDevice handDeviceRequest(const Bytes &hardwareID);
// Checks the server's answer against the setup certificate and derives the keys; false when the
// signature or layout is wrong.
bool handDeviceFinish(const HandDevice &device, const Bytes &sessionInfo, X509 *setupCertificate, Keys &keys);

} // namespace tsapref
