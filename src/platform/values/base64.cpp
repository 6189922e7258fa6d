#include "platform/values/base64.h"

#include <openssl/evp.h>

#include <climits>
#include <vector>

namespace platform {

namespace {
bool inAlphabet(unsigned char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '+' || c == '/';
}
}  // namespace

std::string base64Encode(std::span<const uint8_t> bytes) {
  std::string out;
  if (bytes.empty()) return out;
  out.resize(4 * ((bytes.size() + 2) / 3) + 1);
  // EVP_EncodeBlock takes an int length; feed large inputs in whole groups of three bytes.
  constexpr size_t kChunk = 3 * (1u << 28);
  size_t written = 0;
  for (size_t off = 0; off < bytes.size(); off += kChunk) {
    size_t n = std::min(kChunk, bytes.size() - off);
    written += static_cast<size_t>(EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data() + written),
                                                   bytes.data() + off, static_cast<int>(n)));
  }
  out.resize(written);
  return out;
}

std::optional<Data> base64DecodeStrict(std::string_view text) {
  if (text.size() % 4 != 0) return std::nullopt;
  if (text.empty()) return Data();
  if (text.size() > static_cast<size_t>(INT_MAX)) return std::nullopt;
  size_t pad = 0;
  if (text.back() == '=') pad = text[text.size() - 2] == '=' ? 2 : 1;
  for (size_t i = 0; i < text.size() - pad; ++i)
    if (!inAlphabet(static_cast<unsigned char>(text[i]))) return std::nullopt;
  std::vector<uint8_t> out(text.size() / 4 * 3);
  int n =
      EVP_DecodeBlock(out.data(), reinterpret_cast<const unsigned char*>(text.data()), static_cast<int>(text.size()));
  if (n < 0) return std::nullopt;
  out.resize(static_cast<size_t>(n) - pad);
  return Data(std::move(out));
}

}  // namespace platform
