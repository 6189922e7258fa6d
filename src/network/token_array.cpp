#include "network/token_array.h"

#include "der/der_item.h"
#include "platform/log.h"
#include "platform/value.h"
#include "support/obfuscated_pointer.h"

using platform::LogLevel;

std::optional<std::vector<platform::Data>> parseTokenArray(const std::optional<platform::Data>& tokenData) {
  if (!tokenData) {
    platform::log(LogLevel::Debug, "[#TokenAuth] tokenArray: %{private}@", std::optional<std::string>());
    return std::nullopt;
  }
  const platform::Data& data = *tokenData;
  // Tokens are cut on every request: skip the debug lines' arguments entirely when they are off.
  const bool debug = platform::Log::enabled(LogLevel::Debug);
  if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] tokens: %{private}@", data);
  if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] tokens.length: %lu", data.length());

  std::vector<platform::Data> tokens;
  // Addresses are compared as integers: the walk's "data end" is the last byte, not one past it,
  // and for empty data it lies before the start, which pointer arithmetic may not express.
  const uint8_t* base = data.bytes();
  const uintptr_t begin = reinterpret_cast<uintptr_t>(base);
  const uintptr_t dataEnd = begin + data.length() - 1;
  uintptr_t itemBegin = begin;
  if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", obfuscatedPointer(base));
  if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] pDataEnd: %p", obfuscatedPointer(reinterpret_cast<const void*>(dataEnd)));

  // The loop runs only while the item start lies strictly before the last byte, so one trailing
  // byte is never decoded; zero-length data hands the decoder an empty range and fails.
  if (data.empty()) {
    DERDecodedItem item{};
    if (DERDecodeItem(DERSlice{base, 0}, &item) != DER_STATUS_OK) return std::nullopt;
  }
  while (itemBegin < dataEnd) {
    const uint8_t* p = base + (itemBegin - begin);
    if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", obfuscatedPointer(p));
    DERDecodedItem item{};
    DERStatus ret = DERDecodeItem(DERSlice{p, dataEnd - itemBegin + 1}, &item);
    if (ret != DER_STATUS_OK) return std::nullopt;
    if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] ret: %d", static_cast<int>(ret));

    const uintptr_t contentStart = reinterpret_cast<uintptr_t>(item.content.data);
    const uintptr_t itemEnd = contentStart + item.content.length - 1;
    const size_t itemLength = itemEnd - itemBegin + 1;
    if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] pItemEnd: %p", obfuscatedPointer(reinterpret_cast<const void*>(itemEnd)));
    if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] itemLength: %zu", itemLength);
    tokens.emplace_back(p, itemLength);

    itemBegin = contentStart + item.content.length;
    if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", obfuscatedPointer(reinterpret_cast<const void*>(itemBegin)));
  }
  if (platform::Log::enabled(LogLevel::Debug))
    if (debug) platform::log(LogLevel::Debug, "[#TokenAuth] tokenArray: %{private}@", platform::Value(platform::Array(tokens.begin(), tokens.end())));
  return tokens;
}
