// Turning what the user typed into call arguments: token bytes from hex, base64 or a file, and
// JSON for the request info and for settings values. Each parser fails with a message fit for the
// user when the input is unusable.
#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "platform/values/data.h"
#include "platform/values/result.h"
#include "platform/values/value.h"

namespace zlkactl {

// Token files larger than this are refused (tokens are a few hundred bytes).
inline constexpr size_t kMaxTokenFileSize = 1 << 20;

// Pairs of hex digits, either letter case, nothing else; "" is an empty token.
platform::Result<platform::Data> parseHexToken(std::string_view text);
// Standard alphabet, "=" padding, no white space.
platform::Result<platform::Data> parseBase64Token(std::string_view text);
// The file's bytes as they are.
platform::Result<platform::Data> readTokenFile(const std::filesystem::path& path);

// A JSON object whose values can all travel to the daemon (no nulls).
platform::Result<platform::Dictionary> parseRequestInfo(std::string_view json);

// A settings value: the JSON value when the text is one JSON value (true, 3, "x", {...}, [...],
// null), otherwise the text itself as a string.
platform::Value parseSettingsValue(std::string_view text);

// Hex with lower-case digits.
std::string hexString(const platform::Data& data);

}  // namespace zlkactl
