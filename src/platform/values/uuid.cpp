#include "platform/values/uuid.h"

#include <openssl/rand.h>

#include <random>

namespace platform {

UUID::UUID() {
  if (RAND_bytes(bytes_.data(), static_cast<int>(bytes_.size())) != 1) {
    std::random_device rd;  // the kernel's generator, should the library's ever fail
    for (auto& b : bytes_) b = static_cast<uint8_t>(rd());
  }
  bytes_[6] = static_cast<uint8_t>((bytes_[6] & 0x0F) | 0x40);
  bytes_[8] = static_cast<uint8_t>((bytes_[8] & 0x3F) | 0x80);
}

// Every signed request carries this string: spelt out by hand, without parsing a format each time.
std::string UUID::UUIDString() const {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (size_t i = 0; i < bytes_.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out.push_back('-');
    out.push_back(kHex[bytes_[i] >> 4]);
    out.push_back(kHex[bytes_[i] & 0x0F]);
  }
  return out;
}

}  // namespace platform
