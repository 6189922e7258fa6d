// System log: log objects (subsystem, category), five levels, printf-style formats with object and
// privacy directives, written to the journal or to stderr.
//
//   platform::log(LogLevel::Default, "[#TokenAuth] tokens: %{private}@ (%lu bytes)", data, n);
//
// Directives: %@ (anything with description(), strings, numbers, optionals: "(null)" when empty),
// %s, %d %i %u %x %X %o %c with h/hh/l/ll/z/j/t modifiers, %f %e %g, %p, %%. "{private}" or
// "{public}" may follow the percent sign; a private argument prints as "<private>" unless the log
// was configured with privateData. Arguments are only formatted when the level is enabled.
//
// Each entry carries the place of the call that wrote it (file, line, function), taken where the
// format string is given, and may carry a MessageID that names the event for alerting:
//
//   platform::log(LogLevel::Default, kMessageSessionOpened, "[#TokenAuth] Tarvex SAP session opened!");
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

namespace platform {

enum class LogLevel { Debug = 0, Info = 1, Default = 2, Error = 3, Fault = 4 };

// logLevelName is the level's name: "debug", "info", "default", "error" or "fault".
std::string_view logLevelName(LogLevel level);
// logLevelFromName is the level of one of those names, exactly as written, else nullopt.
std::optional<LogLevel> logLevelFromName(std::string_view name);
// journalPriority is the level's syslog priority: fault 2, error 3, default 5, info 6, debug 7.
int journalPriority(LogLevel level);

enum class LogBackend { Auto, Journal, Stderr };

// A 128-bit journal MESSAGE_ID as 32 lower-case hex digits (what `systemd-id128 new` prints).
struct MessageID {
  const char* hex;
};

struct LogSettings {
  LogLevel minimum = LogLevel::Default;   // lowest level written
  bool privateData = false;               // show %{private} arguments
  LogBackend backend = LogBackend::Auto;  // Auto: the journal when stderr is connected to it
  std::string identifier = "zlkad";       // SYSLOG_IDENTIFIER and stderr prefix
};
// configureLog replaces the process's log settings; it takes effect for the next entry on every
// thread and cannot fail.
void configureLog(const LogSettings& settings);
// currentLogSettings is a copy of the settings last given to configureLog (the defaults before).
LogSettings currentLogSettings();
// logGoesToJournal is true when entries go to the journal now (the backend, resolved).
bool logGoesToJournal();

// Where a log call is in the source: bound where the format string is given, so that the entry
// names the caller's file, line and function rather than the log back end's. (The builtins rather
// than std::source_location, which the clang of Debian 12 cannot use with its libstdc++.)
struct LogFormat {
  // LogFormat borrows `text` (a literal, in practice) and records where the call is.
  template <class S>
  requires std::is_convertible_v<const S&, std::string_view> LogFormat(const S& text,
                                                                       const char* file = __builtin_FILE(),
                                                                       unsigned line = __builtin_LINE(),
                                                                       const char* function = __builtin_FUNCTION())
      : text(text), file(file), line(line), function(function) {}
  std::string_view text;
  const char* file;
  unsigned line;
  const char* function;
};

// One formatted entry; a sink installed by tests (or tools) receives entries instead of the backend.
struct LogEntry {
  LogLevel level;
  std::string subsystem;
  std::string category;
  std::string message;
  std::string file;  // "src/network/request_pipeline.cpp": from the source tree's root
  unsigned line = 0;
  std::string function;   // "failure": the function's own name, as __func__ gives it
  std::string messageID;  // empty for most entries
};

// The subsystem of the default log's entries in the journal.
inline constexpr char kDefaultSubsystem[] = "com.kestro.ZLKAuthentication";
// journalFields gives the fields an entry is sent to the journal with, each "NAME=value":
// MESSAGE, PRIORITY, SYSLOG_IDENTIFIER, ZLKA_SUBSYSTEM, ZLKA_CATEGORY, CODE_FILE, CODE_LINE,
// CODE_FUNC and MESSAGE_ID when the entry has one. The default log's entries get the subsystem
// kDefaultSubsystem and, as category, the module (source directory) of the call.
std::vector<std::string> journalFields(const LogEntry& entry, const std::string& identifier);
using LogSink = std::function<void(const LogEntry&)>;
// setLogSink sends every later entry to `sink`, called on the writing thread, instead of the
// backend; an empty function restores the backend.
void setLogSink(LogSink sink);

class Log {
 public:
  // defaultLog is the process's log without subsystem or category; it lives as long as the process.
  static const Log& defaultLog();
  // create makes a log for `subsystem` and `category`, or returns null when a name is empty or
  // holds control characters.
  static std::shared_ptr<const Log> create(std::string subsystem, std::string category);

  // The names given to create(), borrowed from this log; empty for the default log.
  const std::string& subsystem() const { return subsystem_; }
  const std::string& category() const { return category_; }
  // enabled is true when entries of `level` are written now (at or above the configured minimum).
  static bool enabled(LogLevel level);

 private:
  Log(std::string subsystem, std::string category) : subsystem_(std::move(subsystem)), category_(std::move(category)) {}
  std::string subsystem_, category_;
};

// A formatted argument; built from the call's arguments only when the level is enabled.
class LogArg {
 public:
  struct Pointer {
    uintptr_t value;
  };
  struct Nil {};
  using Storage = std::variant<int64_t, uint64_t, double, Pointer, std::string, Nil>;

  // LogArg copies what the directive will print: the number, the text, the pointer's address, or
  // the object's description(); an empty optional or null pointer-like object becomes Nil.
  template <class T>
  requires(!std::is_same_v<T, LogArg>) LogArg(const T& v) : v_(convert(v)) {}
  // storage is the converted argument, borrowed from this LogArg.
  const Storage& storage() const { return v_; }

 private:
  template <class T>
  static Storage convert(const T& v) {
    if constexpr (std::is_same_v<T, const char*> || std::is_same_v<T, char*>)
      return v ? Storage(std::string(v)) : Storage(Nil{});
    else if constexpr (std::is_same_v<T, bool>)
      return static_cast<int64_t>(v);
    else if constexpr (std::is_integral_v<T> && std::is_signed_v<T>)
      return static_cast<int64_t>(v);
    else if constexpr (std::is_integral_v<T>)
      return static_cast<uint64_t>(v);
    else if constexpr (std::is_enum_v<T>)
      return static_cast<int64_t>(v);
    else if constexpr (std::is_floating_point_v<T>)
      return static_cast<double>(v);
    else if constexpr (std::is_convertible_v<const T&, std::string_view>)
      return std::string(std::string_view(v));
    else if constexpr (std::is_pointer_v<T> || std::is_null_pointer_v<T>)
      return Pointer{reinterpret_cast<uintptr_t>(v)};
    else if constexpr (requires {
                         v.has_value();
                         *v;
                       })
      return v ? convert(*v) : Storage(Nil{});
    else if constexpr (requires {
                         v.get();
                         v->description();
                       })
      return v ? Storage(v->description()) : Storage(Nil{});
    else
      return v.description();
  }
  Storage v_;
};

// formatLogMessage expands the directives of `format` with `args` in order; it never fails: an
// unknown directive stays as written, a missing argument prints "<missing>", and a private one
// prints "<private>" unless `showPrivate`.
std::string formatLogMessage(std::string_view format, std::span<const LogArg> args, bool showPrivate);
// writeLog formats and writes one entry (when its level is enabled) to the sink, else the journal,
// else stderr when the journal refuses it; `id` may be null. It reports no failure.
void writeLog(const Log& log, LogLevel level, const MessageID* id, const LogFormat& format,
              std::span<const LogArg> args);

// log writes one entry on `target` when `level` is enabled; the arguments are converted only then.
template <class... A>
void log(const Log& target, LogLevel level, LogFormat format, const A&... args) {
  if (!Log::enabled(level)) return;
  if constexpr (sizeof...(A) == 0) {
    writeLog(target, level, nullptr, format, {});
  } else {
    const LogArg argv[] = {LogArg(args)...};
    writeLog(target, level, nullptr, format, argv);
  }
}

// log writes one entry on the default log.
template <class... A>
void log(LogLevel level, LogFormat format, const A&... args) {
  log(Log::defaultLog(), level, format, args...);
}

// The same, on the default log, for an event that operators alert on.
template <class... A>
void log(LogLevel level, MessageID id, LogFormat format, const A&... args) {
  if (!Log::enabled(level)) return;
  if constexpr (sizeof...(A) == 0) {
    writeLog(Log::defaultLog(), level, &id, format, {});
  } else {
    const LogArg argv[] = {LogArg(args)...};
    writeLog(Log::defaultLog(), level, &id, format, argv);
  }
}

}  // namespace platform
