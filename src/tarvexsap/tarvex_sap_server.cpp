#include "tarvexsap/tarvex_sap_server.h"

#include <openssl/err.h>

#include <algorithm>
#include <mutex>

#include "tarvexsap/tsap_crypto.h"
#include "tarvexsap/tsap_protocol.h"
#include "tarvexsap/tsap_replay_window.h"

using Status = TarvexSAPServerStatus;

struct TarvexSAPServer::Association {
  tsap::SessionKeys keys;  // immutable once stored
  std::chrono::steady_clock::time_point expiry;
  std::mutex windowMutex;
  tsap::ReplayWindow window;  // guarded by windowMutex
};

const char* TarvexSAPServerStatusName(TarvexSAPServerStatus status) {
  switch (status) {
    case Status::ok:
      return "ok";
    case Status::malformed:
      return "malformed";
    case Status::unknownSession:
      return "unknownSession";
    case Status::expired:
      return "expired";
    case Status::badSignature:
      return "badSignature";
    case Status::replay:
      return "replay";
    case Status::cryptoFailure:
      return "cryptoFailure";
  }
  return "unknown";
}

platform::Result<std::unique_ptr<TarvexSAPServer>> TarvexSAPServer::create(std::span<const uint8_t> setupCertificateDER,
                                                                           EVP_PKEY* setupKey, Clock clock) {
  platform::Result<TarvexSAPCert> cert = TarvexSAPCertFromDER(setupCertificateDER);
  if (!cert) {
    return platform::Failure{"setup certificate is not one DER certificate"};
  }
  if (setupKey == nullptr || EVP_PKEY_get_base_id(setupKey) != EVP_PKEY_ED25519) {
    return platform::Failure{"setup key is not an Ed25519 key"};
  }
  if (X509_check_private_key(cert->get(), setupKey) != 1) {
    ERR_clear_error();
    return platform::Failure{"setup key does not belong to the setup certificate"};
  }
  EVP_PKEY_up_ref(setupKey);
  TarvexSAPKey key(setupKey);
  return std::unique_ptr<TarvexSAPServer>(
      new TarvexSAPServer({setupCertificateDER.begin(), setupCertificateDER.end()}, std::move(key), std::move(clock)));
}

platform::Result<std::unique_ptr<TarvexSAPServer>> TarvexSAPServer::create(std::span<const uint8_t> setupCertificateDER,
                                                                           std::string_view setupKeyPEM, Clock clock) {
  // A text that holds no key is refused as no Ed25519 key.
  platform::Result<TarvexSAPKey> key = TarvexSAPKeyFromPEM(setupKeyPEM);
  return create(setupCertificateDER, key ? key->get() : nullptr, std::move(clock));
}

TarvexSAPServer::TarvexSAPServer(std::vector<uint8_t> certificate, TarvexSAPKey key, Clock clock)
    : certificate_(std::move(certificate)),
      key_(std::move(key)),
      clock_(clock ? std::move(clock) : Clock(&std::chrono::steady_clock::now)) {}

TarvexSAPServer::~TarvexSAPServer() = default;

TarvexSAPServer::HandshakeResult TarvexSAPServer::handshake(std::string_view sessionIdentifier,
                                                            std::span<const uint8_t> requestBytes,
                                                            std::chrono::seconds ttl) {
  HandshakeResult result;
  tsap::HandshakeRequest request;
  if (sessionIdentifier.empty() || sessionIdentifier.size() > kMaxSessionIdentifierLength ||
      !tsap::parseRequest(requestBytes, request)) {
    result.status = Status::malformed;
    return result;
  }
  tsap::RequestBytes requestCopy{};
  std::copy(requestBytes.begin(), requestBytes.end(), requestCopy.begin());

  tsap::SessionInfo info;
  tsap::PKeyPtr ephemeral = tsap::x25519Generate(info.serverPublic);
  if (!ephemeral || !tsap::randomBytes(info.serverNonce)) {
    return result;
  }
  tsap::Secret<32> z;
  if (!tsap::x25519Derive(ephemeral.get(), request.clientPublic, z)) {
    result.status = Status::malformed;  // low-order or unusable client key
    return result;
  }
  ephemeral.reset();

  // T covers the first 65 bytes only, so the signature slot may be filled afterwards.
  tsap::SessionInfoBytes infoBytes = tsap::encodeSessionInfo(info);
  tsap::Digest t{};
  auto association = std::make_shared<Association>();
  if (!tsap::transcriptHash(requestCopy, infoBytes, t) || !tsap::ed25519Sign(key_.get(), t, info.signature) ||
      !tsap::deriveSessionKeys(z, request.clientNonce, info.serverNonce, t, association->keys)) {
    return result;
  }
  // Clamped so that the conversion to clock ticks cannot overflow.
  constexpr std::chrono::seconds kLongestTTL = std::chrono::hours(24 * 365 * 100);
  const auto now = clock_();
  association->expiry = now + std::clamp(ttl, std::chrono::seconds(0), kLongestTTL);
  {
    std::unique_lock lock(mutex_);
    associations_.insert_or_assign(std::string(sessionIdentifier), std::move(association));
    // Handshakes under ever new identifiers must not grow the table without bound; sweeping
    // whenever it has doubled keeps the cost per handshake constant.
    if (associations_.size() >= pruneThreshold_) {
      std::erase_if(associations_, [now](const auto& entry) { return now >= entry.second->expiry; });
      pruneThreshold_ = std::max(kMinPruneThreshold, 2 * associations_.size());
    }
  }
  result.sessionInfo = tsap::encodeSessionInfo(info);
  result.status = Status::ok;
  return result;
}

std::shared_ptr<TarvexSAPServer::Association> TarvexSAPServer::find(std::string_view sessionIdentifier,
                                                                    Status& status) const {
  std::shared_ptr<Association> association;
  {
    std::shared_lock lock(mutex_);
    const auto it = associations_.find(std::string(sessionIdentifier));
    if (it != associations_.end()) {
      association = it->second;
    }
  }
  if (!association) {
    status = Status::unknownSession;
    return nullptr;
  }
  if (clock_() >= association->expiry) {
    status = Status::expired;
    return nullptr;
  }
  return association;
}

TarvexSAPServer::VerifyResult TarvexSAPServer::verifyRequest(std::string_view sessionIdentifier,
                                                             std::span<const uint8_t> signature,
                                                             std::span<const uint8_t> body) {
  VerifyResult result;
  const auto association = find(sessionIdentifier, result.status);
  if (!association) {
    return result;
  }
  uint64_t seq = 0;
  if (!tsap::checkMessage(association->keys, tsap::Direction::request, signature, body, seq)) {
    result.status = Status::badSignature;
    return result;
  }
  // Only an authentic signature may move the window.
  std::lock_guard lock(association->windowMutex);
  if (!association->window.accept(seq)) {
    result.status = Status::replay;
    return result;
  }
  result.status = Status::ok;
  result.seq = seq;
  return result;
}

TarvexSAPServer::SignResult TarvexSAPServer::signResponse(std::string_view sessionIdentifier, uint64_t seq,
                                                          std::span<const uint8_t> body) {
  SignResult result;
  const auto association = find(sessionIdentifier, result.status);
  if (!association) {
    return result;
  }
  tsap::SignatureBytes signature{};
  if (!tsap::signMessage(association->keys, tsap::Direction::response, seq, body, signature)) {
    result.status = Status::cryptoFailure;
    return result;
  }
  result.signature = signature;
  result.status = Status::ok;
  return result;
}

std::size_t TarvexSAPServer::dropExpired() {
  const auto now = clock_();
  std::unique_lock lock(mutex_);
  return std::erase_if(associations_, [now](const auto& entry) { return now >= entry.second->expiry; });
}

std::size_t TarvexSAPServer::associationCount() const {
  std::shared_lock lock(mutex_);
  return associations_.size();
}
