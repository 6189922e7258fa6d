// Turning what the user typed into call arguments: token bytes from hex, base64 or a file, and
// JSON for the request info and for settings values. Each returns nullopt with *error set to a
// message fit for the user when the input is unusable.
#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "platform/data.h"
#include "platform/value.h"

namespace zlkactl {

// Token files larger than this are refused (tokens are a few hundred bytes).
inline constexpr size_t kMaxTokenFileSize = 1 << 20;

// Pairs of hex digits, either letter case, nothing else; "" is an empty token.
std::optional<platform::Data> parseHexToken(std::string_view text, std::string* error);
// Standard alphabet, "=" padding, no white space.
std::optional<platform::Data> parseBase64Token(std::string_view text, std::string* error);
// The file's bytes as they are.
std::optional<platform::Data> readTokenFile(const std::filesystem::path& path, std::string* error);

// A JSON object whose values can all travel to the daemon (no nulls).
std::optional<platform::Dictionary> parseRequestInfo(std::string_view json, std::string* error);

// A settings value: the JSON value when the text is one JSON value (true, 3, "x", {...}, [...],
// null), otherwise the text itself as a string.
platform::Value parseSettingsValue(std::string_view text);

// Hex with lower-case digits.
std::string hexString(const platform::Data& data);

}  // namespace zlkactl
