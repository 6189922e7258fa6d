// Value: the dynamic values the service passes around (parsed JSON, request info, entitlement
// values): null, Boolean, integer, real, string, bytes, array, dictionary, and an opaque marker for
// things JSON cannot hold (file descriptors, dictionaries with non-string keys).
//
// Containers are immutable once built and shared between copies. Booleans are kept apart from
// numbers, but `isNumber()` and `numberValue()` treat them as the numbers 0 and 1, the way the
// service's rules read Boolean-valued settings and answers.
#pragma once

#include <concepts>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/values/data.h"

namespace platform {

class Value;
using Array = std::vector<Value>;
using Dictionary = std::map<std::string, Value, std::less<>>;

struct Null {
  // Null equals only itself.
  friend bool operator==(Null, Null) { return true; }
};

// A value that has no JSON form; `kind` names it in descriptions ("fd", "dict{int32}", ...).
struct Opaque {
  std::string kind;
  friend bool operator==(const Opaque&, const Opaque&) = default;
};

class Value {
 public:
  Value() = default;  // null
  // Each constructor makes a value of its argument's kind: integers widen to int64_t or uint64_t by
  // signedness, strings, bytes and Opaque are copied or moved in, and an Array or Dictionary moves
  // into storage that every copy of the value then shares. None fails.
  Value(Null) {}
  Value(bool b) : v_(b) {}
  template <std::signed_integral T>
  requires(!std::same_as<T, bool>) Value(T i) : v_(static_cast<int64_t>(i)) {}
  template <std::unsigned_integral T>
  requires(!std::same_as<T, bool>) Value(T u) : v_(static_cast<uint64_t>(u)) {}
  Value(double d) : v_(d) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(Data d) : v_(std::move(d)) {}
  Value(Array a) : v_(std::make_shared<const Array>(std::move(a))) {}
  Value(Dictionary d) : v_(std::make_shared<const Dictionary>(std::move(d))) {}
  Value(Opaque o) : v_(std::move(o)) {}

  // Each is true when the value is of that kind; isNumber() is true for integers, reals and Booleans.
  bool isNull() const { return std::holds_alternative<Null>(v_); }
  bool isBool() const { return std::holds_alternative<bool>(v_); }
  bool isNumber() const;
  bool isString() const { return std::holds_alternative<std::string>(v_); }
  bool isData() const { return std::holds_alternative<Data>(v_); }
  bool isArray() const { return std::holds_alternative<ArrayPtr>(v_); }
  bool isDictionary() const { return std::holds_alternative<DictionaryPtr>(v_); }
  bool isOpaque() const { return std::holds_alternative<Opaque>(v_); }

  // Typed access: a pointer into the value (valid while the value lives), or null when the value
  // is of another kind. integer() answers only signed integers and unsignedInteger() only unsigned
  // ones; neither answers Booleans or reals.
  const std::string* string() const { return std::get_if<std::string>(&v_); }
  const Data* data() const { return std::get_if<Data>(&v_); }
  const Array* array() const;
  const Dictionary* dictionary() const;
  const double* real() const { return std::get_if<double>(&v_); }
  const int64_t* integer() const { return std::get_if<int64_t>(&v_); }
  const uint64_t* unsignedInteger() const { return std::get_if<uint64_t>(&v_); }
  const Opaque* opaque() const { return std::get_if<Opaque>(&v_); }

  // numberValue is the value as a double when isNumber() (true is 1, false 0), else nullopt.
  std::optional<double> numberValue() const;
  // boolValue is true for true and for a number other than 0; false for everything else.
  bool boolValue() const;

  // find returns the dictionary member under `key` (borrowed from this value), or null when this
  // is not a dictionary or has no such key.
  const Value* find(std::string_view key) const;
  // count is the number of members of an array or dictionary; 0 for anything else.
  size_t count() const;

  // Numbers compare by value across integer and real; Booleans equal only Booleans.
  friend bool operator==(const Value& a, const Value& b);

  // The kind of value, for log lines: "Null", "Boolean", "Number", "String", "Data", "Array",
  // "Dictionary" or the opaque kind.
  std::string typeName() const;

  // A readable rendering for logs: JSON-like, bytes as Data::description().
  std::string description() const;

 private:
  using ArrayPtr = std::shared_ptr<const Array>;
  using DictionaryPtr = std::shared_ptr<const Dictionary>;
  std::variant<Null, bool, int64_t, uint64_t, double, std::string, Data, ArrayPtr, DictionaryPtr, Opaque> v_;
};

}  // namespace platform
