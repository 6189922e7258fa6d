#include "platform/log/log.h"

#include <sys/stat.h>
#include <sys/uio.h>
// Otherwise sd_journal_sendv adds CODE_FILE, CODE_LINE and CODE_FUNC of this file to the caller's.
#define SD_JOURNAL_SUPPRESS_LOCATION
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
int sendToJournal(const LogEntry& entry, const std::string& identifier) {
  std::vector<std::string> fields = journalFields(entry, identifier);
  std::vector<iovec> vector(fields.size());
  for (size_t i = 0; i < fields.size(); ++i) vector[i] = {fields[i].data(), fields[i].size()};
  return sd_journal_sendv(vector.data(), static_cast<int>(vector.size()));
}

// The compiler names files as it was given them (absolute, or relative to the build tree under
// ccache); the journal gets them from the source tree's root, as a reader looks them up.
std::string_view sourcePath(std::string_view file) {
  size_t best = std::string_view::npos;
  for (std::string_view root : {"src/", "tools/", "tests/", "bench/", "fuzz/"})
    for (size_t at = file.find(root); at != std::string_view::npos; at = file.find(root, at + 1))
      if ((at == 0 || file[at - 1] == '/') && (best == std::string_view::npos || at > best)) best = at;
  return best == std::string_view::npos ? file : file.substr(best);
}

// The module of a call: the directory under src/ (or tools/) that holds its file.
std::string_view moduleOf(std::string_view file) {
  for (std::string_view root : {"src/platform/", "src/", "tools/", "tests/"})
    if (file.starts_with(root)) {
      std::string_view rest = file.substr(root.size());
      size_t slash = rest.find('/');
      if (slash != std::string_view::npos) return rest.substr(0, slash);
    }
  return "zlkad";
}

}  // namespace

std::vector<std::string> journalFields(const LogEntry& entry, const std::string& identifier) {
  std::vector<std::string> fields = {
      "MESSAGE=" + entry.message,
      "PRIORITY=" + std::to_string(journalPriority(entry.level)),
      "SYSLOG_IDENTIFIER=" + identifier,
      "ZLKA_SUBSYSTEM=" + (entry.subsystem.empty() ? std::string(kDefaultSubsystem) : entry.subsystem),
      "ZLKA_CATEGORY=" + (entry.subsystem.empty() ? std::string(moduleOf(entry.file)) : entry.category),
      "CODE_FILE=" + entry.file,
      "CODE_LINE=" + std::to_string(entry.line),
      "CODE_FUNC=" + entry.function,
  };
  if (!entry.messageID.empty()) fields.push_back("MESSAGE_ID=" + entry.messageID);
  return fields;
}

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

bool logGoesToJournal() {
  LogState& s = state();
  std::lock_guard lock(s.mutex);
  return s.useJournal;
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

void writeLog(const Log& log, LogLevel level, const MessageID* id, const LogFormat& format,
              std::span<const LogArg> args) {
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
  LogEntry entry{level,
                 log.subsystem(),
                 log.category(),
                 formatLogMessage(format.text, args, gPrivateData.load(std::memory_order_relaxed)),
                 std::string(sourcePath(format.file)),
                 format.line,
                 format.function,
                 id ? id->hex : ""};
  if (sink) {
    (*sink)(entry);
    return;
  }
  if (journal && sendToJournal(entry, identifier) >= 0) return;
  writeStderr(identifier, log, level, entry.message);
}

}  // namespace platform
