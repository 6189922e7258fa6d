// Error: a failure as a value: domain, signed code, and an optional user-info dictionary that may
// carry a human-readable message under LocalizedDescriptionKey. "No user-info" (nullopt) is
// distinct from an empty dictionary.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/values/value.h"

namespace platform {

inline constexpr char LocalizedDescriptionKey[] = "LocalizedDescription";

class Error {
 public:
  // Error makes an error of `domain` and `code`; `userInfo` nullopt means none at all.
  Error(std::string domain, int64_t code, std::optional<Dictionary> userInfo = std::nullopt)
      : domain_(std::move(domain)), code_(code), userInfo_(std::move(userInfo)) {}

  // The parts given at construction, borrowed from this error.
  const std::string& domain() const { return domain_; }
  int64_t code() const { return code_; }
  const std::optional<Dictionary>& userInfo() const { return userInfo_; }

  // The user-info message when there is one, else a generic text naming domain and code.
  std::string localizedDescription() const;
  // "Error Domain=D Code=C \"message\" UserInfo={...}" for logs.
  std::string description() const;

  friend bool operator==(const Error&, const Error&) = default;

 private:
  std::string domain_;
  int64_t code_;
  std::optional<Dictionary> userInfo_;
};

}  // namespace platform
