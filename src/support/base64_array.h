// Base64 of arrays of byte buffers, element by element.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/data.h"

// Standard base64 with padding, no line breaks; no array gives an empty array.
std::vector<std::string> base64EncodeArray(const std::optional<std::vector<platform::Data>>& array);

// Strict decoding; an element that does not decode is dropped without a word, so the result may be
// shorter than the input and its positions need not match.
std::vector<platform::Data> base64DecodeArray(const std::vector<std::string>& array);
