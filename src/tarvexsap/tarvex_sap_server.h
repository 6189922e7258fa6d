// Server side of the secure association (TSAP1), for the reference server and the tests.
//
// Holds the setup certificate (DER) and its Ed25519 private key, and a table of associations
// keyed by session identifier.
//  handshake      checks a 90-byte handshake request, answers the 129-byte session info and
//                 stores the association for `ttl`; a new handshake replaces the identifier's
//                 association. Status malformed is an HTTP 400.
//  verifyRequest  checks a 40-byte request signature over the body and its seq against the
//                 replay window (1024 wide, ending at the highest accepted seq; seq 0 never
//                 valid). unknownSession, expired, badSignature, replay are HTTP 401.
//  signResponse   40-byte response signature: the seq echoed, MAC over the exact body.
//  dropExpired    removes associations past their expiry (expired when now >= expiry);
//                 handshakes also sweep them whenever the table has doubled in size.
// Transport encodings (base64, JSON) are the caller's. Thread-safe.
#pragma once

#include <openssl/evp.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <shared_mutex>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/values/result.h"
#include "tarvexsap/tarvex_sap_certs.h"

enum class TarvexSAPServerStatus {
  ok,
  malformed,       // handshake request or session identifier unacceptable
  unknownSession,  // no association under the identifier
  expired,         // association past its time-to-live
  badSignature,    // wrong length or MAC mismatch
  replay,          // seq 0, already seen, or below the window
  cryptoFailure,   // the crypto library failed
};

// TarvexSAPServerStatusName is the status's constant name for logs ("badSignature"); static storage.
const char* TarvexSAPServerStatusName(TarvexSAPServerStatus status);

class TarvexSAPServer {
 public:
  using Clock = std::function<std::chrono::steady_clock::time_point()>;

  struct HandshakeResult {
    TarvexSAPServerStatus status = TarvexSAPServerStatus::cryptoFailure;
    std::array<uint8_t, 129> sessionInfo{};
  };
  struct VerifyResult {
    TarvexSAPServerStatus status = TarvexSAPServerStatus::cryptoFailure;
    uint64_t seq = 0;  // the accepted seq, to echo in the response signature
  };
  struct SignResult {
    TarvexSAPServerStatus status = TarvexSAPServerStatus::cryptoFailure;
    std::array<uint8_t, 40> signature{};
  };

  // create returns a server, owned by the caller, for the setup certificate `setupCertificateDER`
  // (copied) and its Ed25519 `setupKey` (the server takes a reference); it fails, saying which,
  // unless the certificate is one DER certificate, the key is Ed25519 and it is the certificate's.
  // A null clock means std::chrono::steady_clock::now.
  static platform::Result<std::unique_ptr<TarvexSAPServer>> create(std::span<const uint8_t> setupCertificateDER,
                                                                   EVP_PKEY* setupKey, Clock clock = nullptr);
  // create with the key as unencrypted PEM text; it fails as above, and when the text holds no key.
  static platform::Result<std::unique_ptr<TarvexSAPServer>> create(std::span<const uint8_t> setupCertificateDER,
                                                                   std::string_view setupKeyPEM, Clock clock = nullptr);
  ~TarvexSAPServer();
  TarvexSAPServer(const TarvexSAPServer&) = delete;
  TarvexSAPServer& operator=(const TarvexSAPServer&) = delete;

  // The certificate to serve to devices.
  const std::vector<uint8_t>& setupCertificateDER() const { return certificate_; }

  // handshake answers a device's 90-byte handshake `request` with the signed session info and keeps
  // the association under `sessionIdentifier` for `ttl` (replacing one of that name). Its status is
  // malformed for an empty or over-long identifier, a request that does not parse or a low-order
  // device key, and cryptoFailure when OpenSSL fails; nothing is kept then.
  HandshakeResult handshake(std::string_view sessionIdentifier, std::span<const uint8_t> request,
                            std::chrono::seconds ttl);
  // verifyRequest checks a device's 40-byte `signature` of `body` and, when it is good, records its
  // seq as seen and returns it. Its status is unknownSession, expired, badSignature or replay
  // otherwise, and nothing is recorded.
  VerifyResult verifyRequest(std::string_view sessionIdentifier, std::span<const uint8_t> signature,
                             std::span<const uint8_t> body);
  // signResponse signs `body` as the answer to the request of sequence number `seq`. Its status is
  // unknownSession, expired or cryptoFailure otherwise.
  SignResult signResponse(std::string_view sessionIdentifier, uint64_t seq, std::span<const uint8_t> body);

  // dropExpired removes the associations past their time-to-live and returns how many it removed.
  std::size_t dropExpired();
  // associationCount counts the associations kept, expired ones not yet dropped included.
  std::size_t associationCount() const;

  // Identifiers longer than this are refused as malformed.
  static constexpr std::size_t kMaxSessionIdentifierLength = 256;

 private:
  struct Association;
  // Takes the checked certificate and key; cannot fail.
  TarvexSAPServer(std::vector<uint8_t> certificate, TarvexSAPKey key, Clock clock);

  std::shared_ptr<Association> find(std::string_view sessionIdentifier, TarvexSAPServerStatus& status) const;

  std::vector<uint8_t> certificate_;
  TarvexSAPKey key_;
  Clock clock_;
  mutable std::shared_mutex mutex_;
  std::unordered_map<std::string, std::shared_ptr<Association>> associations_;  // guarded by mutex_
  static constexpr std::size_t kMinPruneThreshold = 1024;
  std::size_t pruneThreshold_ = kMinPruneThreshold;  // guarded by mutex_
};
