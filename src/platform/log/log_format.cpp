// Formatting of log messages: the printf-style directives, the object and privacy directives,
// and the bound on how much one argument may print.
#include <algorithm>
#include <cinttypes>
#include <cstdio>

#include "platform/log/log.h"

namespace platform {

namespace {

void appendNumber(std::string& out, const char* directive, const LogArg::Storage& arg) {
  char buf[128];
  std::string f(directive);
  char conv = f.back();
  // Re-emit with a length modifier that matches how the argument is held.
  std::string base = f.substr(0, f.size() - 1);
  while (!base.empty() && std::string_view("hljztL").find(base.back()) != std::string_view::npos) base.pop_back();
  int n = 0;
  if (conv == 'f' || conv == 'F' || conv == 'e' || conv == 'E' || conv == 'g' || conv == 'G') {
    double d = 0;
    if (auto p = std::get_if<double>(&arg))
      d = *p;
    else if (auto i = std::get_if<int64_t>(&arg))
      d = static_cast<double>(*i);
    else if (auto u = std::get_if<uint64_t>(&arg))
      d = static_cast<double>(*u);
    n = std::snprintf(buf, sizeof buf, (base + conv).c_str(), d);
  } else if (conv == 'c') {
    int c = '?';
    if (auto i = std::get_if<int64_t>(&arg))
      c = static_cast<int>(*i);
    else if (auto u = std::get_if<uint64_t>(&arg))
      c = static_cast<int>(*u);
    n = std::snprintf(buf, sizeof buf, (base + 'c').c_str(), c);
  } else {
    bool isSigned = conv == 'd' || conv == 'i';
    if (auto i = std::get_if<int64_t>(&arg)) {
      if (isSigned)
        n = std::snprintf(buf, sizeof buf, (base + "ll" + conv).c_str(), static_cast<long long>(*i));
      else
        n = std::snprintf(buf, sizeof buf, (base + "ll" + conv).c_str(), static_cast<unsigned long long>(*i));
    } else if (auto u = std::get_if<uint64_t>(&arg)) {
      if (isSigned)
        n = std::snprintf(buf, sizeof buf, (base + "ll" + conv).c_str(), static_cast<long long>(*u));
      else
        n = std::snprintf(buf, sizeof buf, (base + "ll" + conv).c_str(), static_cast<unsigned long long>(*u));
    } else if (auto d = std::get_if<double>(&arg)) {
      n = std::snprintf(buf, sizeof buf, (base + "ll" + conv).c_str(), static_cast<long long>(*d));
    } else if (auto p = std::get_if<LogArg::Pointer>(&arg)) {
      n = std::snprintf(buf, sizeof buf, (base + "ll" + conv).c_str(), static_cast<unsigned long long>(p->value));
    } else {
      out += "(null)";
      return;
    }
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

}  // namespace

std::string formatLogMessage(std::string_view format, std::span<const LogArg> args, bool showPrivate) {
  std::string out;
  out.reserve(format.size() + 32);
  size_t next = 0;
  for (size_t i = 0; i < format.size(); ++i) {
    char c = format[i];
    if (c != '%') {
      out += c;
      continue;
    }
    size_t start = i++;
    if (i >= format.size()) {
      out += '%';
      break;
    }
    if (format[i] == '%') {
      out += '%';
      continue;
    }
    bool isPrivate = false;
    if (format[i] == '{') {
      size_t close = format.find('}', i);
      if (close == std::string_view::npos) {
        out.append(format.substr(start));
        break;
      }
      std::string_view annotation = format.substr(i + 1, close - i - 1);
      isPrivate = annotation.find("private") != std::string_view::npos;
      i = close + 1;
    }
    // flags, width, precision, length modifiers
    std::string directive = "%";
    while (i < format.size() && std::string_view("-+ #0123456789.").find(format[i]) != std::string_view::npos)
      directive += format[i++];
    while (i < format.size() && std::string_view("hljztL").find(format[i]) != std::string_view::npos)
      directive += format[i++];
    if (i >= format.size()) {
      out.append(format.substr(start));
      break;
    }
    char conv = format[i];
    if (std::string_view("@sdiuxXocfFeEgGp").find(conv) == std::string_view::npos) {
      out.append(format.substr(start, i - start + 1));  // unknown directive: keep it visible
      continue;
    }
    if (next >= args.size()) {
      out += "<missing>";
      continue;
    }
    const LogArg::Storage& arg = args[next++].storage();
    if (isPrivate && !showPrivate) {
      out += "<private>";
      continue;
    }
    directive += conv;
    switch (conv) {
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
        appendNumber(out, directive.c_str(), arg);
        break;
    }
  }
  return out;
}

}  // namespace platform
