// Standard base64 (RFC 4648 alphabet, "=" padding, no line breaks). Decoding is strict: any
// character outside the alphabet (white space included), a wrong length or misplaced padding fails.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/data.h"

namespace platform {

std::string base64Encode(std::span<const uint8_t> bytes);
std::optional<Data> base64DecodeStrict(std::string_view text);

}  // namespace platform
