#include "support/hex.h"

#include <cstdio>
#include <cstring>
#include <vector>

namespace {
uint8_t nibble(char c) {
  if (c >= '0' && c <= '9') return static_cast<uint8_t>(c - '0');
  if (c >= 'A' && c <= 'F') return static_cast<uint8_t>(c - 'A' + 10);
  if (c >= 'a' && c <= 'f') return static_cast<uint8_t>(c - 'a' + 10);
  return 0;
}

bool isHexDigit(char c) { return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'F') || (c >= 'a' && c <= 'f'); }
}  // namespace

void ascii_to_hex(uint8_t* out, const char* in, size_t length) {
  for (size_t i = 0; i + 1 < length; i += 2) out[i / 2] = static_cast<uint8_t>(nibble(in[i]) << 4 | nibble(in[i + 1]));
}

std::optional<platform::Data> convertNSStringToNSData(const std::optional<std::string>& text) {
  if (!text) return std::nullopt;
  std::string digits;
  digits.reserve(text->size());
  for (char c : *text)
    if (isHexDigit(c)) digits += c;
  std::vector<uint8_t> bytes(digits.size() / 2);
  ascii_to_hex(bytes.data(), digits.data(), digits.size());
  return platform::Data(std::move(bytes));
}

std::optional<std::string> convertNSDataToNSString(const std::optional<platform::Value>& data, const char* byteFormat) {
  if (!data || !data->data() || !byteFormat) return std::nullopt;
  std::string out;
  char buf[64];
  for (uint8_t b : data->data()->span()) {
    int n = std::snprintf(buf, sizeof buf, byteFormat, static_cast<unsigned>(b));
    if (n > 0) out.append(buf, std::min(static_cast<size_t>(n), sizeof buf - 1));
  }
  return out;
}

void printBytes(const uint8_t* bytes, size_t count, const char* byteFormat, bool newline) {
  if (!bytes || count == 0) return;
  for (size_t i = 0; i < count; ++i) std::printf(byteFormat, static_cast<unsigned>(bytes[i]));
  if (newline) std::printf("\n");
}

char* removeNewline(char* text) {
  if (!text) return text;
  size_t n = std::strlen(text);
  if (n > 0 && text[n - 1] == '\n') text[n - 1] = '\0';
  return text;
}
