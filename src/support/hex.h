// Hex text and byte helpers. Both hex parsers read a nibble from 0-9, A-F and a-f and take any
// other character as 0, without reporting it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/data.h"
#include "platform/value.h"

// Parses floor(length / 2) pairs of hex characters into bytes (first character the high nibble).
void ascii_to_hex(uint8_t* out, const char* in, size_t length);

// Drops every non-hex character, then parses the rest in pairs; an odd last digit is dropped.
std::optional<platform::Data> convertNSStringToNSData(const std::optional<std::string>& text);

// Formats each byte with the caller's printf format (e.g. "%02x") and concatenates the results;
// nullopt when the value is absent or not bytes.
std::optional<std::string> convertNSDataToNSString(const std::optional<platform::Value>& data, const char* byteFormat);

// Prints each byte with the format to stdout, then a line feed if asked; nothing for no bytes.
void printBytes(const uint8_t* bytes, size_t count, const char* byteFormat, bool newline);

// Cuts one trailing line feed (never a carriage return); returns its argument.
char* removeNewline(char* text);
