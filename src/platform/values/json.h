// JSON serialisation of Values: the validity test, compact or pretty writing, strict parsing.
//
// Valid for writing means: the top level is an array or a dictionary, and everything inside is a
// string, number, Boolean, null, array or dictionary, with no NaN or infinite number. Parsing is
// strict RFC 8259 with the top level an object or an array; nesting deeper than kMaxDepth is refused
// so that hostile input cannot exhaust the stack.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/values/value.h"

namespace platform::json {

inline constexpr int kMaxDepth = 256;

// isValidJSONObject is true when `value` is valid for writing (above).
bool isValidJSONObject(const Value& value);

// serialize returns `value` as JSON text, compact unless `pretty`, or nullopt (with a reason in
// *error when `error` is not null) when the value is not valid for writing.
std::optional<std::string> serialize(const Value& value, bool pretty = false, std::string* error = nullptr);

// parse returns the value `text` holds, or nullopt (with the parser's message in *error when
// `error` is not null) for anything but a well-formed object or array within kMaxDepth.
std::optional<Value> parse(std::string_view text, std::string* error = nullptr);

}  // namespace platform::json
