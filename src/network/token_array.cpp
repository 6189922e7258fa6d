#include "network/token_array.h"

#include "der/der_item.h"
#include "platform/log/log.h"
#include "platform/values/value.h"
#include "support/obfuscated_pointer.h"

using platform::Data;
using platform::LogLevel;

namespace {

// Cuts `data` into the DER items that lie end to end in it. The walk stops while one byte is left,
// so a trailing byte is never decoded; empty data is handed to the decoder, which refuses it.
// False when an item does not decode; `tokens` then holds the items cut before it.
bool cut(const Data& data, std::vector<Data>& tokens) {
  const uint8_t* at = data.bytes();
  size_t left = data.length();
  if (left == 0) {
    DERDecodedItem item{};
    return DERDecodeItem(DERSlice{at, 0}, &item) == DER_STATUS_OK;
  }
  while (left > 1) {
    DERDecodedItem item{};
    if (DERDecodeItem(DERSlice{at, left}, &item) != DER_STATUS_OK) return false;
    const size_t length = static_cast<size_t>(item.content.data + item.content.length - at);
    tokens.emplace_back(at, length);
    at += length;
    left -= length;
  }
  return true;
}

// The walk told in debug lines, after it ran: the items lie end to end from the start, so every
// position is known from their lengths. Addresses are integers here because the "data end" of
// empty data lies before its start, which a pointer may not express.
void narrate(const Data& data, const std::vector<Data>& tokens, bool complete) {
  auto pointer = [](uintptr_t address) { return obfuscatedPointer(reinterpret_cast<const void*>(address)); };
  const uintptr_t begin = reinterpret_cast<uintptr_t>(data.bytes());
  platform::log(LogLevel::Debug, "[#TokenAuth] tokens: %{private}@", data);
  platform::log(LogLevel::Debug, "[#TokenAuth] tokens.length: %lu", data.length());
  platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", pointer(begin));
  platform::log(LogLevel::Debug, "[#TokenAuth] pDataEnd: %p", pointer(begin + data.length() - 1));
  uintptr_t itemBegin = begin;
  for (const Data& token : tokens) {
    platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", pointer(itemBegin));
    platform::log(LogLevel::Debug, "[#TokenAuth] ret: %d", static_cast<int>(DER_STATUS_OK));
    platform::log(LogLevel::Debug, "[#TokenAuth] pItemEnd: %p", pointer(itemBegin + token.length() - 1));
    platform::log(LogLevel::Debug, "[#TokenAuth] itemLength: %zu", token.length());
    itemBegin += token.length();
    platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", pointer(itemBegin));
  }
  if (!complete) {
    // The item that did not decode was announced before the decoder refused it.
    if (!data.empty()) platform::log(LogLevel::Debug, "[#TokenAuth] pItemBegin: %p", pointer(itemBegin));
    return;
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] tokenArray: %{private}@",
                platform::Value(platform::Array(tokens.begin(), tokens.end())));
}

}  // namespace

std::optional<std::vector<Data>> parseTokenArray(const std::optional<Data>& tokenData) {
  if (!tokenData) {
    platform::log(LogLevel::Debug, "[#TokenAuth] tokenArray: %{private}@", std::optional<std::string>());
    return std::nullopt;
  }
  std::vector<Data> tokens;
  const bool complete = cut(*tokenData, tokens);
  // Tokens are cut on every request: the narration costs nothing unless debug lines are written.
  if (platform::Log::enabled(LogLevel::Debug)) narrate(*tokenData, tokens, complete);
  if (!complete) return std::nullopt;
  return tokens;
}
