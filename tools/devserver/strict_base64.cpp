#include "devserver/strict_base64.h"

#include <openssl/evp.h>

#include <climits>

namespace devserver {

namespace {

bool inAlphabet(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '+' || c == '/';
}

}  // namespace

std::string base64Encode(std::span<const uint8_t> bytes) {
  std::string out;
  // EVP_EncodeBlock takes an int length; feed it whole groups of three bytes.
  constexpr std::size_t kChunk = 3u << 28;
  out.resize(4 * ((bytes.size() + 2) / 3) + 1);
  std::size_t written = 0;
  for (std::size_t offset = 0; offset < bytes.size(); offset += kChunk) {
    const std::size_t n = std::min(kChunk, bytes.size() - offset);
    written += static_cast<std::size_t>(EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data() + written),
                                                        bytes.data() + offset, static_cast<int>(n)));
  }
  out.resize(written);
  return out;
}

std::string base64Encode(std::string_view bytes) {
  return base64Encode(std::span(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size()));
}

std::optional<std::vector<uint8_t>> base64DecodeStrict(std::string_view text) {
  if (text.size() % 4 != 0 || text.size() > static_cast<std::size_t>(INT_MAX)) {
    return std::nullopt;
  }
  if (text.empty()) {
    return std::vector<uint8_t>{};
  }
  std::size_t padding = 0;
  if (text.back() == '=') {
    padding = text[text.size() - 2] == '=' ? 2 : 1;
  }
  // EVP_DecodeBlock skips white space and accepts '=' in odd places; refuse both first.
  for (std::size_t i = 0; i < text.size() - padding; ++i) {
    if (!inAlphabet(text[i])) {
      return std::nullopt;
    }
  }
  std::vector<uint8_t> out(text.size() / 4 * 3);
  const int n =
      EVP_DecodeBlock(out.data(), reinterpret_cast<const unsigned char*>(text.data()), static_cast<int>(text.size()));
  if (n < 0 || static_cast<std::size_t>(n) < padding) {
    return std::nullopt;
  }
  out.resize(static_cast<std::size_t>(n) - padding);
  return out;
}

}  // namespace devserver
