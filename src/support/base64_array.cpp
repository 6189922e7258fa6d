#include "support/base64_array.h"

#include "platform/base64.h"

std::vector<std::string> base64EncodeArray(const std::optional<std::vector<platform::Data>>& array) {
  std::vector<std::string> out;
  if (!array) return out;
  out.reserve(array->size());
  for (const platform::Data& d : *array) out.push_back(platform::base64Encode(d.span()));
  return out;
}

std::vector<platform::Data> base64DecodeArray(const std::vector<std::string>& array) {
  std::vector<platform::Data> out;
  out.reserve(array.size());
  for (const std::string& s : array)
    if (auto d = platform::base64DecodeStrict(s)) out.push_back(std::move(*d));
  return out;
}
