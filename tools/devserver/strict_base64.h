// Base64 as the device side speaks it: standard alphabet, padding required, no white space.
//  base64Encode        never fails.
//  base64DecodeStrict  nullopt for anything that is not exactly such a text.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace devserver {

std::string base64Encode(std::span<const uint8_t> bytes);
std::string base64Encode(std::string_view bytes);
std::optional<std::vector<uint8_t>> base64DecodeStrict(std::string_view text);

}  // namespace devserver
