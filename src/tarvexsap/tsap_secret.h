// Fixed-size secret byte array that erases itself (OPENSSL_cleanse) when destroyed or cleared.
// Used for every key and shared secret of the association, on both sides.
#pragma once

#include <openssl/crypto.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

namespace tsap {

template <std::size_t N>
class Secret {
 public:
  // Secret starts as N zero bytes.
  Secret() { bytes_.fill(0); }
  ~Secret() { clear(); }
  Secret(const Secret&) = delete;
  Secret& operator=(const Secret&) = delete;

  // clear erases the bytes in a way the compiler cannot elide.
  void clear() { OPENSSL_cleanse(bytes_.data(), bytes_.size()); }
  // Views of the N bytes, valid while the secret lives.
  uint8_t* data() { return bytes_.data(); }
  const uint8_t* data() const { return bytes_.data(); }
  static constexpr std::size_t size() { return N; }
  std::span<uint8_t, N> span() { return std::span<uint8_t, N>(bytes_); }
  std::span<const uint8_t, N> span() const { return std::span<const uint8_t, N>(bytes_); }

 private:
  std::array<uint8_t, N> bytes_;
};

}  // namespace tsap
