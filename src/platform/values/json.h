// JSON serialisation of Values: the validity test, compact or pretty writing, strict parsing.
//
// Valid for writing means: the top level is an array or a dictionary, and everything inside is a
// string, number, Boolean, null, array or dictionary, with no NaN or infinite number. Parsing is
// strict RFC 8259 with the top level an object or an array; nesting deeper than kMaxDepth is refused
// so that hostile input cannot exhaust the stack.
#pragma once

#include <string>
#include <string_view>

#include "platform/values/result.h"
#include "platform/values/value.h"

namespace platform::json {

inline constexpr int kMaxDepth = 256;

// isValidJSONObject is true when `value` is valid for writing (above).
bool isValidJSONObject(const Value& value);

// serialize returns `value` as JSON text, compact unless `pretty`, or a failure saying why when the
// value is not valid for writing.
Result<std::string> serialize(const Value& value, bool pretty = false);

// parse returns the value `text` holds, or a failure with the parser's message for anything but a
// well-formed object or array within kMaxDepth.
Result<Value> parse(std::string_view text);

}  // namespace platform::json
