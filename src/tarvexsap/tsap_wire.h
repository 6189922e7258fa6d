// TSAP1 wire layouts shared by the device and the server: sizes, labels, the 90-byte handshake
// request, the 129-byte session info and the 40-byte message signature.
// Labels are plain ASCII with no terminator and no length prefix.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

namespace tsap {

inline constexpr int32_t kExchangeSelector = 200;
inline constexpr uint8_t kVersion = 1;
inline constexpr std::string_view kMagic = "TSAP";

inline constexpr std::size_t kHardwareIDMax = 20;
inline constexpr std::size_t kKeySize = 32;
inline constexpr std::size_t kNonceSize = 32;
inline constexpr std::size_t kEd25519SignatureSize = 64;
inline constexpr std::size_t kSeqSize = 8;
inline constexpr std::size_t kMacSize = 32;

inline constexpr std::size_t kRequestSize = 90;
inline constexpr std::size_t kSessionInfoSize = 129;
inline constexpr std::size_t kSessionInfoSignedPrefix = 65;  // version, server key, server nonce
inline constexpr std::size_t kSignatureSize = kSeqSize + kMacSize;

// Unanswered device signatures kept, and width of the server's replay window.
inline constexpr std::size_t kMaxOutstanding = 1024;
inline constexpr std::size_t kReplayWindow = 1024;

inline constexpr std::string_view kLabelHardwareID = "TSAP1 hwid";
inline constexpr std::string_view kLabelTranscript = "TSAP1 transcript";
inline constexpr std::string_view kLabelKeys = "TSAP1 keys";
inline constexpr std::string_view kLabelRequest = "TSAP1 req";
inline constexpr std::string_view kLabelResponse = "TSAP1 rsp";

using RequestBytes = std::array<uint8_t, kRequestSize>;
using SessionInfoBytes = std::array<uint8_t, kSessionInfoSize>;
using SignatureBytes = std::array<uint8_t, kSignatureSize>;

struct HandshakeRequest {
  uint8_t idLength = 0;
  std::array<uint8_t, kHardwareIDMax> id{};
  std::array<uint8_t, kKeySize> clientPublic{};
  std::array<uint8_t, kNonceSize> clientNonce{};
};

struct SessionInfo {
  std::array<uint8_t, kKeySize> serverPublic{};
  std::array<uint8_t, kNonceSize> serverNonce{};
  std::array<uint8_t, kEd25519SignatureSize> signature{};
};

// Bytes after idLength in `id` are written as zero whatever they hold.
RequestBytes encodeRequest(const HandshakeRequest& request);
// False unless: exactly 90 bytes, magic, version 1, n <= 20 and zero padding after n.
bool parseRequest(std::span<const uint8_t> bytes, HandshakeRequest& request);

// encodeSessionInfo lays out the 129-byte session info, version 1.
SessionInfoBytes encodeSessionInfo(const SessionInfo& info);
// False unless exactly 129 bytes with version 1.
bool parseSessionInfo(std::span<const uint8_t> bytes, SessionInfo& info);

// putSeq writes `seq` big-endian; getSeq reads it back.
void putSeq(uint64_t seq, std::span<uint8_t, kSeqSize> out);
uint64_t getSeq(std::span<const uint8_t, kSeqSize> in);

// labelBytes views the characters of `label`, without its NUL, as bytes; it borrows them.
inline std::span<const uint8_t> labelBytes(std::string_view label) {
  return {reinterpret_cast<const uint8_t*>(label.data()), label.size()};
}

}  // namespace tsap
