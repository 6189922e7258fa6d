// UUID: 16 random bytes (version 4, RFC 4122 variant) rendered canonically in upper case
// ("E621E1F8-C36C-495A-93FC-0C247A3E6E5F").
#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace platform {

class UUID {
 public:
  UUID();  // a fresh random UUID
  const std::array<uint8_t, 16>& bytes() const { return bytes_; }
  std::string UUIDString() const;
  friend bool operator==(const UUID&, const UUID&) = default;

 private:
  std::array<uint8_t, 16> bytes_{};
};

}  // namespace platform
