#include "zlkactl/token_input.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "client/request_encoding.h"
#include "platform/values/base64.h"
#include "platform/values/json.h"
#include "platform/values/unique_fd.h"

namespace zlkactl {

namespace {

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

platform::Result<platform::Data> parseHexToken(std::string_view text) {
  std::vector<uint8_t> bytes;
  bytes.reserve(text.size() / 2);
  for (size_t i = 0; i < text.size(); ++i) {
    if (hexDigit(text[i]) < 0)
      return platform::Failure{"--token-hex: character " + std::to_string(i + 1) + " is not a hex digit"};
  }
  if (text.size() % 2 != 0) return platform::Failure{"--token-hex: an odd number of hex digits"};
  for (size_t i = 0; i < text.size(); i += 2)
    bytes.push_back(static_cast<uint8_t>(hexDigit(text[i]) << 4 | hexDigit(text[i + 1])));
  return platform::Data(std::move(bytes));
}

platform::Result<platform::Data> parseBase64Token(std::string_view text) {
  if (std::optional<platform::Data> data = platform::base64DecodeStrict(text)) return *std::move(data);
  return platform::Failure{"--token-base64: not valid base64 (standard alphabet, '=' padding, no white space)"};
}

platform::Result<platform::Data> readTokenFile(const std::filesystem::path& path) {
  auto failure = [&](int e) {
    return platform::Failure{"--token-file: cannot read " + path.string() + ": " + std::strerror(e)};
  };
  platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return failure(errno);
  std::vector<uint8_t> bytes;
  uint8_t buffer[8192];
  for (;;) {
    ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return failure(errno);
    if (n == 0) break;
    bytes.insert(bytes.end(), buffer, buffer + n);
    if (bytes.size() > kMaxTokenFileSize)
      return platform::Failure{"--token-file: " + path.string() + " is larger than " +
                               std::to_string(kMaxTokenFileSize) + " bytes"};
  }
  return platform::Data(std::move(bytes));
}

platform::Result<platform::Dictionary> parseRequestInfo(std::string_view json) {
  platform::Result<platform::Value> value = platform::json::parse(json);
  if (!value) return platform::Failure{"--request-info: not valid JSON: " + value.error()};
  if (!value->dictionary()) return platform::Failure{"--request-info: must be a JSON object, not an array"};
  if (auto reason = zlka_client::unsendableReason(*value, "requestInfo"))
    return platform::Failure{"--request-info: " + *reason};
  return *value->dictionary();
}

platform::Value parseSettingsValue(std::string_view text) {
  // The JSON parser takes only objects and arrays at the top: wrap the text as the sole member of
  // an array, which also accepts scalars and refuses "1,2" (two members).
  platform::Result<platform::Value> wrapped = platform::json::parse("[" + std::string(text) + "]");
  if (wrapped && wrapped->count() == 1) return wrapped->array()->front();
  return platform::Value(std::string(text));
}

std::string hexString(const platform::Data& data) {
  static constexpr char digits[] = "0123456789abcdef";
  std::string out;
  out.reserve(data.length() * 2);
  for (uint8_t byte : data.span()) {
    out.push_back(digits[byte >> 4]);
    out.push_back(digits[byte & 0x0F]);
  }
  return out;
}

}  // namespace zlkactl
