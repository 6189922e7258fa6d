#include "tarvexsap/tsap_wire.h"

#include <algorithm>

namespace tsap {
namespace {

constexpr std::size_t kIdLengthOffset = 5;
constexpr std::size_t kIdOffset = 6;
constexpr std::size_t kClientPublicOffset = kIdOffset + kHardwareIDMax;
constexpr std::size_t kClientNonceOffset = kClientPublicOffset + kKeySize;
static_assert(kClientNonceOffset + kNonceSize == kRequestSize);

constexpr std::size_t kServerPublicOffset = 1;
constexpr std::size_t kServerNonceOffset = kServerPublicOffset + kKeySize;
constexpr std::size_t kInfoSignatureOffset = kServerNonceOffset + kNonceSize;
static_assert(kInfoSignatureOffset == kSessionInfoSignedPrefix);
static_assert(kInfoSignatureOffset + kEd25519SignatureSize == kSessionInfoSize);

}  // namespace

RequestBytes encodeRequest(const HandshakeRequest& request) {
  RequestBytes out{};
  std::copy(kMagic.begin(), kMagic.end(), out.begin());
  out[4] = kVersion;
  const std::size_t n = std::min<std::size_t>(request.idLength, kHardwareIDMax);
  out[kIdLengthOffset] = static_cast<uint8_t>(n);
  std::copy_n(request.id.begin(), n, out.begin() + kIdOffset);
  std::copy(request.clientPublic.begin(), request.clientPublic.end(), out.begin() + kClientPublicOffset);
  std::copy(request.clientNonce.begin(), request.clientNonce.end(), out.begin() + kClientNonceOffset);
  return out;
}

bool parseRequest(std::span<const uint8_t> bytes, HandshakeRequest& request) {
  if (bytes.size() != kRequestSize || !std::equal(kMagic.begin(), kMagic.end(), bytes.begin()) ||
      bytes[4] != kVersion || bytes[kIdLengthOffset] > kHardwareIDMax) {
    return false;
  }
  const std::size_t n = bytes[kIdLengthOffset];
  const auto id = bytes.subspan(kIdOffset, kHardwareIDMax);
  if (std::any_of(id.begin() + static_cast<std::ptrdiff_t>(n), id.end(), [](uint8_t b) { return b != 0; })) {
    return false;
  }
  request.idLength = static_cast<uint8_t>(n);
  std::copy(id.begin(), id.end(), request.id.begin());
  std::copy_n(bytes.begin() + kClientPublicOffset, kKeySize, request.clientPublic.begin());
  std::copy_n(bytes.begin() + kClientNonceOffset, kNonceSize, request.clientNonce.begin());
  return true;
}

SessionInfoBytes encodeSessionInfo(const SessionInfo& info) {
  SessionInfoBytes out{};
  out[0] = kVersion;
  std::copy(info.serverPublic.begin(), info.serverPublic.end(), out.begin() + kServerPublicOffset);
  std::copy(info.serverNonce.begin(), info.serverNonce.end(), out.begin() + kServerNonceOffset);
  std::copy(info.signature.begin(), info.signature.end(), out.begin() + kInfoSignatureOffset);
  return out;
}

bool parseSessionInfo(std::span<const uint8_t> bytes, SessionInfo& info) {
  if (bytes.size() != kSessionInfoSize || bytes[0] != kVersion) {
    return false;
  }
  std::copy_n(bytes.begin() + kServerPublicOffset, kKeySize, info.serverPublic.begin());
  std::copy_n(bytes.begin() + kServerNonceOffset, kNonceSize, info.serverNonce.begin());
  std::copy_n(bytes.begin() + kInfoSignatureOffset, kEd25519SignatureSize, info.signature.begin());
  return true;
}

void putSeq(uint64_t seq, std::span<uint8_t, kSeqSize> out) {
  for (std::size_t i = 0; i < kSeqSize; ++i) {
    out[i] = static_cast<uint8_t>(seq >> (8 * (kSeqSize - 1 - i)));
  }
}

uint64_t getSeq(std::span<const uint8_t, kSeqSize> in) {
  uint64_t seq = 0;
  for (uint8_t b : in) {
    seq = (seq << 8) | b;
  }
  return seq;
}

}  // namespace tsap
