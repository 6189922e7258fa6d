// Formatting of log messages: the printf-style directives, the object and privacy directives,
// and the bound on how much one argument may print.
#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <optional>

#include "platform/log/log.h"

namespace platform {

namespace {

bool isRealConversion(char conv) { return std::string_view("fFeEgG").find(conv) != std::string_view::npos; }

double realOf(const LogArg::Storage& arg) {
  if (auto p = std::get_if<double>(&arg)) return *p;
  if (auto i = std::get_if<int64_t>(&arg)) return static_cast<double>(*i);
  if (auto u = std::get_if<uint64_t>(&arg)) return static_cast<double>(*u);
  return 0;
}

int characterOf(const LogArg::Storage& arg) {
  if (auto i = std::get_if<int64_t>(&arg)) return static_cast<int>(*i);
  if (auto u = std::get_if<uint64_t>(&arg)) return static_cast<int>(*u);
  return '?';
}

// The 64 bits an integer conversion prints (a real is truncated first); nullopt for none.
std::optional<unsigned long long> integerBitsOf(const LogArg::Storage& arg) {
  if (auto i = std::get_if<int64_t>(&arg)) return static_cast<unsigned long long>(*i);
  if (auto u = std::get_if<uint64_t>(&arg)) return *u;
  if (auto d = std::get_if<double>(&arg)) return static_cast<unsigned long long>(static_cast<long long>(*d));
  if (auto p = std::get_if<LogArg::Pointer>(&arg)) return static_cast<unsigned long long>(p->value);
  return std::nullopt;
}

void appendNumber(std::string& out, const char* directive, const LogArg::Storage& arg) {
  char buf[128];
  std::string f(directive);
  char conv = f.back();
  // Re-emit with a length modifier that matches how the argument is held.
  std::string base = f.substr(0, f.size() - 1);
  while (!base.empty() && std::string_view("hljztL").find(base.back()) != std::string_view::npos) base.pop_back();
  int n = 0;
  if (isRealConversion(conv)) {
    n = std::snprintf(buf, sizeof buf, (base + conv).c_str(), realOf(arg));
  } else if (conv == 'c') {
    n = std::snprintf(buf, sizeof buf, (base + 'c').c_str(), characterOf(arg));
  } else {
    std::optional<unsigned long long> bits = integerBitsOf(arg);
    if (!bits) {
      out += "(null)";
      return;
    }
    std::string pattern = base + "ll" + conv;
    n = conv == 'd' || conv == 'i' ? std::snprintf(buf, sizeof buf, pattern.c_str(), static_cast<long long>(*bits))
                                   : std::snprintf(buf, sizeof buf, pattern.c_str(), *bits);
  }
  if (n > 0) out.append(buf, std::min<size_t>(static_cast<size_t>(n), sizeof buf - 1));
}

void appendObject(std::string& out, const LogArg::Storage& arg) {
  if (auto s = std::get_if<std::string>(&arg))
    out += *s;
  else if (auto i = std::get_if<int64_t>(&arg))
    out += std::to_string(*i);
  else if (auto u = std::get_if<uint64_t>(&arg))
    out += std::to_string(*u);
  else if (auto d = std::get_if<double>(&arg)) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%.17g", *d);
    out += buf;
  } else if (auto p = std::get_if<LogArg::Pointer>(&arg)) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "0x%" PRIxPTR, p->value);
    out += buf;
  } else {
    out += "(null)";
  }
}

void appendPointer(std::string& out, const LogArg::Storage& arg) {
  uintptr_t v = 0;
  if (auto p = std::get_if<LogArg::Pointer>(&arg))
    v = p->value;
  else if (auto u = std::get_if<uint64_t>(&arg))
    v = static_cast<uintptr_t>(*u);
  else if (auto i = std::get_if<int64_t>(&arg))
    v = static_cast<uintptr_t>(*i);
  if (v == 0) {
    out += "0x0";
    return;
  }
  char buf[32];
  std::snprintf(buf, sizeof buf, "0x%" PRIxPTR, v);
  out += buf;
}

// One argument of an entry holds at most this much of its text: a server's body can be megabytes.
constexpr size_t kMaximumArgumentBytes = 4096;

// Cuts what `appendObject` just added after `start` down to the cap (at a UTF-8 character
// boundary) and says how much was left out.
void capArgument(std::string& out, size_t start) {
  if (out.size() - start <= kMaximumArgumentBytes) return;
  size_t cut = start + kMaximumArgumentBytes;
  while (cut > start && (static_cast<unsigned char>(out[cut]) & 0xC0) == 0x80) --cut;
  size_t leftOut = out.size() - cut;
  out.resize(cut);
  out += "... (" + std::to_string(leftOut) + " more bytes)";
}

// One directive of a format string, from its '%' up to `end`: either a conversion that takes an
// argument, or text that is copied as it stands (a "%%", or a directive that is incomplete or
// unknown, kept visible).
struct Directive {
  size_t end = 0;
  char conv = 0;  // 0: copy `literal`
  std::string_view literal;
  std::string pattern;  // "%", flags, width, precision, length modifiers and the conversion
  bool isPrivate = false;
};

Directive copied(size_t end, std::string_view literal) {
  Directive d;
  d.end = end;
  d.literal = literal;
  return d;
}

Directive readDirective(std::string_view format, size_t start) {
  size_t i = start + 1;
  if (i >= format.size()) return copied(format.size(), "%");
  if (format[i] == '%') return copied(i + 1, "%");
  Directive d;
  if (format[i] == '{') {
    size_t close = format.find('}', i);
    if (close == std::string_view::npos) return copied(format.size(), format.substr(start));
    std::string_view annotation = format.substr(i + 1, close - i - 1);
    d.isPrivate = annotation.find("private") != std::string_view::npos;
    i = close + 1;
  }
  d.pattern = "%";
  while (i < format.size() && std::string_view("-+ #0123456789.").find(format[i]) != std::string_view::npos)
    d.pattern += format[i++];
  while (i < format.size() && std::string_view("hljztL").find(format[i]) != std::string_view::npos)
    d.pattern += format[i++];
  if (i >= format.size()) return copied(format.size(), format.substr(start));
  if (std::string_view("@sdiuxXocfFeEgGp").find(format[i]) == std::string_view::npos)
    return copied(i + 1, format.substr(start, i - start + 1));
  d.end = i + 1;
  d.conv = format[i];
  d.pattern += d.conv;
  return d;
}

void appendArgument(std::string& out, const Directive& directive, const LogArg::Storage& arg) {
  switch (directive.conv) {
    case '@':
    case 's': {
      size_t start = out.size();
      appendObject(out, arg);
      capArgument(out, start);
      break;
    }
    case 'p':
      appendPointer(out, arg);
      break;
    default:
      appendNumber(out, directive.pattern.c_str(), arg);
      break;
  }
}

}  // namespace

std::string formatLogMessage(std::string_view format, std::span<const LogArg> args, bool showPrivate) {
  std::string out;
  out.reserve(format.size() + 32);
  size_t next = 0;
  size_t i = 0;
  while (i < format.size()) {
    if (format[i] != '%') {
      out += format[i++];
      continue;
    }
    const Directive directive = readDirective(format, i);
    i = directive.end;
    if (!directive.conv) {
      out.append(directive.literal);
      continue;
    }
    if (next >= args.size()) {
      out += "<missing>";
      continue;
    }
    const LogArg::Storage& arg = args[next++].storage();
    if (directive.isPrivate && !showPrivate) {
      out += "<private>";
      continue;
    }
    appendArgument(out, directive, arg);
  }
  return out;
}

}  // namespace platform
