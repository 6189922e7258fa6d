#include "tarvexsap/tsap_protocol.h"

#include <algorithm>

namespace tsap {
namespace {

bool messageMac(const SessionKeys& keys, Direction direction, std::span<const uint8_t, kSeqSize> seq, Bytes data,
                Digest& mac) {
  const bool isRequest = direction == Direction::request;
  const auto& key = isRequest ? keys.request : keys.response;
  return hmacSha256(key.span(), {labelBytes(isRequest ? kLabelRequest : kLabelResponse), seq, data}, mac);
}

}  // namespace

bool transcriptHash(const RequestBytes& request, const SessionInfoBytes& info, Digest& t) {
  return sha256({labelBytes(kLabelTranscript), request, Bytes(info.data(), kSessionInfoSignedPrefix)}, t);
}

bool deriveSessionKeys(const Secret<32>& z, std::span<const uint8_t, kNonceSize> clientNonce,
                       std::span<const uint8_t, kNonceSize> serverNonce, const Digest& t, SessionKeys& keys) {
  std::array<uint8_t, 2 * kNonceSize> salt{};
  std::copy(clientNonce.begin(), clientNonce.end(), salt.begin());
  std::copy(serverNonce.begin(), serverNonce.end(), salt.begin() + kNonceSize);
  std::array<uint8_t, kLabelKeys.size() + 32> info{};
  std::copy(kLabelKeys.begin(), kLabelKeys.end(), info.begin());
  std::copy(t.begin(), t.end(), info.begin() + kLabelKeys.size());

  Secret<2 * kKeySize> okm;
  if (!hkdfSha256(z.span(), salt, info, okm.span())) {
    return false;
  }
  std::copy_n(okm.data(), kKeySize, keys.request.data());
  std::copy_n(okm.data() + kKeySize, kKeySize, keys.response.data());
  return true;
}

bool signMessage(const SessionKeys& keys, Direction direction, uint64_t seq, Bytes data, SignatureBytes& out) {
  auto seqBytes = std::span<uint8_t, kSeqSize>(out.data(), kSeqSize);
  putSeq(seq, seqBytes);
  Digest mac{};
  if (!messageMac(keys, direction, seqBytes, data, mac)) {
    return false;
  }
  std::copy(mac.begin(), mac.end(), out.begin() + kSeqSize);
  return true;
}

bool checkMessage(const SessionKeys& keys, Direction direction, Bytes signature, Bytes data, uint64_t& seq) {
  if (signature.size() != kSignatureSize) {
    return false;
  }
  const auto seqBytes = signature.first<kSeqSize>();
  Digest mac{};
  if (!messageMac(keys, direction, seqBytes, data, mac) ||
      !equalConstantTime(mac, signature.subspan(kSeqSize, kMacSize))) {
    return false;
  }
  seq = getSeq(seqBytes);
  return true;
}

}  // namespace tsap
