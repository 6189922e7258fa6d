#include "platform/values/json.h"

#include <cmath>
#include <nlohmann/json.hpp>

namespace platform::json {

namespace {

using nlohmann::json;

bool validMember(const Value& v, int depth) {
  if (depth > kMaxDepth) return false;
  if (v.isNull() || v.isBool() || v.isString() || v.integer() || v.unsignedInteger()) return true;
  if (auto d = v.real()) return std::isfinite(*d);
  if (auto a = v.array()) {
    for (const Value& m : *a)
      if (!validMember(m, depth + 1)) return false;
    return true;
  }
  if (auto d = v.dictionary()) {
    for (const auto& [k, m] : *d)
      if (!validMember(m, depth + 1)) return false;
    return true;
  }
  return false;  // bytes, opaque values
}

json toJSON(const Value& v) {
  if (v.isBool()) return v.boolValue();
  if (auto i = v.integer()) return *i;
  if (auto u = v.unsignedInteger()) return *u;
  if (auto d = v.real()) return *d;
  if (auto s = v.string()) return *s;
  if (auto a = v.array()) {
    json out = json::array();
    for (const Value& m : *a) out.push_back(toJSON(m));
    return out;
  }
  if (auto d = v.dictionary()) {
    json out = json::object();
    for (const auto& [k, m] : *d) out[k] = toJSON(m);
    return out;
  }
  return nullptr;
}

Value fromJSON(const json& j) {
  switch (j.type()) {
    case json::value_t::boolean:
      return Value(j.get<bool>());
    case json::value_t::number_integer:
      return Value(j.get<int64_t>());
    case json::value_t::number_unsigned:
      return Value(j.get<uint64_t>());
    case json::value_t::number_float:
      return Value(j.get<double>());
    case json::value_t::string:
      return Value(j.get_ref<const std::string&>());
    case json::value_t::array: {
      Array a;
      a.reserve(j.size());
      for (const json& m : j) a.push_back(fromJSON(m));
      return Value(std::move(a));
    }
    case json::value_t::object: {
      Dictionary d;
      for (const auto& [k, m] : j.items()) d.emplace(k, fromJSON(m));
      return Value(std::move(d));
    }
    default:
      return Value();
  }
}

// Bracket depth outside strings; the parser itself is iterative but our conversion is not.
bool depthWithinLimit(std::string_view text) {
  int depth = 0;
  bool inString = false;
  for (size_t i = 0; i < text.size(); ++i) {
    char c = text[i];
    if (inString) {
      if (c == '\\')
        ++i;
      else if (c == '"')
        inString = false;
    } else if (c == '"') {
      inString = true;
    } else if (c == '[' || c == '{') {
      if (++depth > kMaxDepth) return false;
    } else if (c == ']' || c == '}') {
      --depth;
    }
  }
  return true;
}

}  // namespace

bool isValidJSONObject(const Value& value) {
  return (value.isArray() || value.isDictionary()) && validMember(value, 0);
}

Result<std::string> serialize(const Value& value, bool pretty) {
  if (!isValidJSONObject(value)) return Failure{"Invalid type in JSON write"};
  try {
    return toJSON(value).dump(pretty ? 2 : -1, ' ', false, json::error_handler_t::strict);
  } catch (const json::exception& e) {  // strings that are not UTF-8: the library's one way to say so
    return Failure{e.what()};
  }
}

Result<Value> parse(std::string_view text) {
  if (!depthWithinLimit(text)) return Failure{"JSON nesting is deeper than " + std::to_string(kMaxDepth) + " levels"};
  try {
    json j = json::parse(text.begin(), text.end());
    if (!j.is_object() && !j.is_array()) return Failure{"JSON text did not start with array or object"};
    return fromJSON(j);
  } catch (const json::exception& e) {  // the parser's message says where the text went wrong
    return Failure{e.what()};
  }
}

}  // namespace platform::json
