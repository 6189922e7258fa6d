// Standard base64 (RFC 4648 alphabet, "=" padding, no line breaks). Decoding is strict: any
// character outside the alphabet (white space included), a wrong length or misplaced padding fails.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/values/data.h"

namespace platform {

// base64Encode returns `bytes` in base64 with padding; the empty span gives "".
std::string base64Encode(std::span<const uint8_t> bytes);
// base64DecodeStrict returns the bytes `text` encodes, or nullopt when it is not strict base64.
std::optional<Data> base64DecodeStrict(std::string_view text);

}  // namespace platform
