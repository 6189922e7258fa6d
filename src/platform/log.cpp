#include "platform/log.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <mutex>

namespace platform {

namespace {

bool stderrIsJournal();

struct LogState {
  std::mutex mutex;
  LogSettings settings;
  std::shared_ptr<const LogSink> sink;
  bool useJournal = stderrIsJournal();
};

LogState& state() {
  static LogState s;
  return s;
}

std::atomic<int> gMinimum{static_cast<int>(LogLevel::Default)};
std::atomic<bool> gPrivateData{false};

// The journal convention: stderr is the journal when JOURNAL_STREAM names its device and inode.
bool stderrIsJournal() {
  const char* env = std::getenv("JOURNAL_STREAM");
  if (!env) return false;
  unsigned long long dev = 0, ino = 0;
  if (std::sscanf(env, "%llu:%llu", &dev, &ino) != 2) return false;
  struct stat st {};
  if (fstat(STDERR_FILENO, &st) != 0) return false;
  return st.st_dev == dev && st.st_ino == ino;
}

bool hasControlCharacters(const std::string& s) {
  for (unsigned char c : s)
    if (c < 0x20 || c == 0x7F) return true;
  return false;
}

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

std::string timestamp() {
  using namespace std::chrono;
  auto now = system_clock::now();
  std::time_t t = system_clock::to_time_t(now);
  auto ms = duration_cast<milliseconds>(now.time_since_epoch()).count() % 1000;
  std::tm tm{};
  localtime_r(&t, &tm);
  char buf[40];
  size_t n = std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S", &tm);
  std::snprintf(buf + n, sizeof buf - n, ".%03d", static_cast<int>(ms));
  return buf;
}

// A control byte in logged text (a server's body, a caller's string) could end the line early, forge
// another or recolour a terminal: on stderr each one is shown as an escape instead.
void appendEscaped(std::string& line, std::string_view text) {
  for (char c : text) {
    auto byte = static_cast<unsigned char>(c);
    if (byte >= 0x20 && byte != 0x7F) {
      line += c;
      continue;
    }
    switch (c) {
      case '\n':
        line += "\\n";
        break;
      case '\r':
        line += "\\r";
        break;
      case '\t':
        line += "\\t";
        break;
      default: {
        char buf[8];
        std::snprintf(buf, sizeof buf, "\\x%02x", byte);
        line += buf;
      }
    }
  }
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

void writeStderr(const std::string& identifier, const Log& log, LogLevel level, const std::string& message) {
  std::string line =
      timestamp() + " " + identifier + "[" + std::to_string(getpid()) + "] <" + std::string(logLevelName(level)) + ">";
  if (!log.subsystem().empty()) line += " [" + log.subsystem() + ":" + log.category() + "]";
  line += ' ';
  appendEscaped(line, message);
  line += '\n';
  // One write per entry keeps lines from concurrent threads whole.
  const char* p = line.data();
  size_t left = line.size();
  while (left > 0) {
    ssize_t w = ::write(STDERR_FILENO, p, left);
    if (w <= 0) break;
    p += w;
    left -= static_cast<size_t>(w);
  }
}

// Fields go out with their lengths, so a message holding a NUL reaches the journal whole.
int sendToJournal(const Log& log, LogLevel level, const std::string& identifier, const std::string& message) {
  std::string fields[] = {"MESSAGE=" + message, "PRIORITY=" + std::to_string(journalPriority(level)),
                          "SYSLOG_IDENTIFIER=" + identifier, "ZLKA_SUBSYSTEM=" + log.subsystem(),
                          "ZLKA_CATEGORY=" + log.category()};
  iovec vector[std::size(fields)];
  size_t count = log.subsystem().empty() ? 3 : std::size(fields);
  for (size_t i = 0; i < count; ++i) vector[i] = {fields[i].data(), fields[i].size()};
  return sd_journal_sendv(vector, static_cast<int>(count));
}

}  // namespace

std::string_view logLevelName(LogLevel level) {
  switch (level) {
    case LogLevel::Debug:
      return "debug";
    case LogLevel::Info:
      return "info";
    case LogLevel::Default:
      return "default";
    case LogLevel::Error:
      return "error";
    case LogLevel::Fault:
      return "fault";
  }
  return "default";
}

std::optional<LogLevel> logLevelFromName(std::string_view name) {
  for (LogLevel l : {LogLevel::Debug, LogLevel::Info, LogLevel::Default, LogLevel::Error, LogLevel::Fault})
    if (logLevelName(l) == name) return l;
  return std::nullopt;
}

int journalPriority(LogLevel level) {
  switch (level) {
    case LogLevel::Fault:
      return 2;
    case LogLevel::Error:
      return 3;
    case LogLevel::Default:
      return 5;
    case LogLevel::Info:
      return 6;
    case LogLevel::Debug:
      return 7;
  }
  return 5;
}

void configureLog(const LogSettings& settings) {
  LogState& s = state();
  std::lock_guard lock(s.mutex);
  s.settings = settings;
  s.useJournal = settings.backend == LogBackend::Journal || (settings.backend == LogBackend::Auto && stderrIsJournal());
  gMinimum.store(static_cast<int>(settings.minimum), std::memory_order_relaxed);
  gPrivateData.store(settings.privateData, std::memory_order_relaxed);
}

LogSettings currentLogSettings() {
  LogState& s = state();
  std::lock_guard lock(s.mutex);
  return s.settings;
}

void setLogSink(LogSink sink) {
  LogState& s = state();
  std::lock_guard lock(s.mutex);
  s.sink = sink ? std::make_shared<const LogSink>(std::move(sink)) : nullptr;
}

const Log& Log::defaultLog() {
  static const Log log("", "");
  return log;
}

std::shared_ptr<const Log> Log::create(std::string subsystem, std::string category) {
  if (subsystem.empty() || category.empty() || hasControlCharacters(subsystem) || hasControlCharacters(category))
    return nullptr;
  return std::shared_ptr<const Log>(new Log(std::move(subsystem), std::move(category)));
}

bool Log::enabled(LogLevel level) { return static_cast<int>(level) >= gMinimum.load(std::memory_order_relaxed); }

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

void writeLog(const Log& log, LogLevel level, std::string_view format, std::span<const LogArg> args) {
  if (!Log::enabled(level)) return;
  std::shared_ptr<const LogSink> sink;
  bool journal;
  std::string identifier;
  {
    LogState& s = state();
    std::lock_guard lock(s.mutex);
    sink = s.sink;
    journal = s.useJournal;
    identifier = s.settings.identifier;
  }
  std::string message = formatLogMessage(format, args, gPrivateData.load(std::memory_order_relaxed));
  if (sink) {
    (*sink)(LogEntry{level, log.subsystem(), log.category(), std::move(message)});
    return;
  }
  if (journal && sendToJournal(log, level, identifier, message) >= 0) return;
  writeStderr(identifier, log, level, message);
}

}  // namespace platform
