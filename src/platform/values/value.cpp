#include "platform/values/value.h"

#include <cmath>
#include <cstdio>

namespace platform {

bool Value::isNumber() const { return isBool() || integer() || unsignedInteger() || real(); }

const Array* Value::array() const {
  auto p = std::get_if<ArrayPtr>(&v_);
  return p ? p->get() : nullptr;
}

const Dictionary* Value::dictionary() const {
  auto p = std::get_if<DictionaryPtr>(&v_);
  return p ? p->get() : nullptr;
}

std::optional<double> Value::numberValue() const {
  if (auto b = std::get_if<bool>(&v_)) return *b ? 1.0 : 0.0;
  if (auto i = integer()) return static_cast<double>(*i);
  if (auto u = unsignedInteger()) return static_cast<double>(*u);
  if (auto d = real()) return *d;
  return std::nullopt;
}

bool Value::boolValue() const {
  if (auto b = std::get_if<bool>(&v_)) return *b;
  if (auto i = integer()) return *i != 0;
  if (auto u = unsignedInteger()) return *u != 0;
  if (auto d = real()) return *d != 0.0;
  return false;
}

const Value* Value::find(std::string_view key) const {
  const Dictionary* d = dictionary();
  if (!d) return nullptr;
  auto it = d->find(key);
  return it == d->end() ? nullptr : &it->second;
}

size_t Value::count() const {
  if (auto a = array()) return a->size();
  if (auto d = dictionary()) return d->size();
  return 0;
}

namespace {

// Exact comparison of two numbers held as integer, unsigned or real.
bool numbersEqual(const Value& a, const Value& b) {
  if (a.integer() && b.integer()) return *a.integer() == *b.integer();
  if (a.unsignedInteger() && b.unsignedInteger()) return *a.unsignedInteger() == *b.unsignedInteger();
  if (a.integer() && b.unsignedInteger())
    return *a.integer() >= 0 && static_cast<uint64_t>(*a.integer()) == *b.unsignedInteger();
  if (a.unsignedInteger() && b.integer()) return numbersEqual(b, a);
  return *a.numberValue() == *b.numberValue();
}

void appendQuoted(std::string& out, const std::string& s) {
  out += '"';
  for (char c : s) {
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          char buf[8];
          std::snprintf(buf, sizeof buf, "\\u%04x", static_cast<unsigned>(static_cast<unsigned char>(c)));
          out += buf;
        } else {
          out += c;
        }
    }
  }
  out += '"';
}

void describe(std::string& out, const Value& v) {
  if (v.isNull()) {
    out += "null";
  } else if (v.isBool()) {
    out += v.boolValue() ? "true" : "false";
  } else if (auto i = v.integer()) {
    out += std::to_string(*i);
  } else if (auto u = v.unsignedInteger()) {
    out += std::to_string(*u);
  } else if (auto d = v.real()) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%.17g", *d);
    out += buf;
  } else if (auto s = v.string()) {
    appendQuoted(out, *s);
  } else if (auto data = v.data()) {
    out += data->description();
  } else if (auto a = v.array()) {
    out += '[';
    for (size_t k = 0; k < a->size(); ++k) {
      if (k) out += ", ";
      describe(out, (*a)[k]);
    }
    out += ']';
  } else if (auto dict = v.dictionary()) {
    out += '{';
    bool first = true;
    for (const auto& [key, member] : *dict) {
      if (!first) out += ", ";
      first = false;
      appendQuoted(out, key);
      out += ": ";
      describe(out, member);
    }
    out += '}';
  } else if (auto o = v.opaque()) {
    out += "<" + o->kind + ">";
  }
}

}  // namespace

bool operator==(const Value& a, const Value& b) {
  if (a.isBool() || b.isBool()) return a.isBool() && b.isBool() && a.boolValue() == b.boolValue();
  if (a.isNumber() && b.isNumber()) return numbersEqual(a, b);
  if (a.v_.index() != b.v_.index()) return false;
  if (auto x = a.array()) return *x == *b.array();
  if (auto x = a.dictionary()) return *x == *b.dictionary();
  return a.v_ == b.v_;
}

std::string Value::typeName() const {
  if (isNull()) return "Null";
  if (isBool()) return "Boolean";
  if (isNumber()) return "Number";
  if (isString()) return "String";
  if (isData()) return "Data";
  if (isArray()) return "Array";
  if (isDictionary()) return "Dictionary";
  return opaque()->kind;
}

std::string Value::description() const {
  std::string out;
  describe(out, *this);
  return out;
}

}  // namespace platform
