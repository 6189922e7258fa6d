#include "platform/uuid.h"

#include <openssl/rand.h>

#include <cstdio>
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

std::string UUID::UUIDString() const {
  char out[37];
  const uint8_t* b = bytes_.data();
  std::snprintf(out, sizeof out, "%02X%02X%02X%02X-%02X%02X-%02X%02X-%02X%02X-%02X%02X%02X%02X%02X%02X", b[0], b[1], b[2],
                b[3], b[4], b[5], b[6], b[7], b[8], b[9], b[10], b[11], b[12], b[13], b[14], b[15]);
  return out;
}

}  // namespace platform
