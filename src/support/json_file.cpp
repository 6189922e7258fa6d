#include "support/json_file.h"

#include <fstream>
#include <sstream>

#include "platform/config/atomic_file.h"
#include "platform/values/json.h"

std::optional<platform::Value> readJSONFile(const std::optional<std::filesystem::path>& path) {
  if (!path) return std::nullopt;
  std::ifstream in(*path, std::ios::binary);
  if (!in) return std::nullopt;
  std::stringstream buffer;
  buffer << in.rdbuf();
  if (in.bad()) return std::nullopt;
  platform::Result<platform::Value> parsed = platform::json::parse(buffer.str());
  if (!parsed) return std::nullopt;
  return std::move(parsed).value();
}

bool writeJSONFile(const std::optional<platform::Value>& object, const std::optional<std::filesystem::path>& path) {
  if (!path) return false;
  platform::Result<std::string> text =
      platform::json::serialize(object ? *object : platform::Value(platform::Dictionary{}), true);
  if (!text) return false;
  return !platform::writeFileAtomically(*path, *text);
}
