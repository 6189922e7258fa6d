// JSON files: strict reading, pretty-printed atomic writing.
#pragma once

#include <filesystem>
#include <optional>

#include "platform/value.h"

// The parsed object or array; nullopt for no path, an unreadable file or any parse error.
std::optional<platform::Value> readJSONFile(const std::optional<std::filesystem::path>& path);

// Writes pretty-printed JSON through a temporary file renamed over the target. No object writes {};
// false for no path, a value JSON cannot hold, or a failed write.
bool writeJSONFile(const std::optional<platform::Value>& object, const std::optional<std::filesystem::path>& path);
