// UUID: 16 random bytes (version 4, RFC 4122 variant) rendered canonically in upper case
// ("E621E1F8-C36C-495A-93FC-0C247A3E6E5F").
#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace platform {

class UUID {
 public:
  // UUID makes a fresh random one from OpenSSL's generator, or the kernel's should that fail.
  UUID();
  // bytes are the 16 bytes in network order, borrowed from this UUID.
  const std::array<uint8_t, 16>& bytes() const { return bytes_; }
  // UUIDString is the canonical upper-case form, 36 characters with hyphens.
  std::string UUIDString() const;
  friend bool operator==(const UUID&, const UUID&) = default;

 private:
  std::array<uint8_t, 16> bytes_{};
};

}  // namespace platform
