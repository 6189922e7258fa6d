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

std::string_view logLevelName(LogLevel level);  // "debug", "info", "default", "error", "fault"
std::optional<LogLevel> logLevelFromName(std::string_view name);
int journalPriority(LogLevel level);  // fault 2, error 3, default 5, info 6, debug 7

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
void configureLog(const LogSettings& settings);
LogSettings currentLogSettings();
// logGoesToJournal is true when entries go to the journal now (the backend, resolved).
bool logGoesToJournal();

// Where a log call is in the source: bound where the format string is given, so that the entry
// names the caller's file, line and function rather than the log back end's. (The builtins rather
// than std::source_location, which the clang of Debian 12 cannot use with its libstdc++.)
struct LogFormat {
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

// journalFields gives the fields an entry is sent to the journal with, each "NAME=value":
// MESSAGE, PRIORITY, SYSLOG_IDENTIFIER, ZLKA_SUBSYSTEM, ZLKA_CATEGORY, CODE_FILE, CODE_LINE,
// CODE_FUNC and MESSAGE_ID when the entry has one. The default log's entries get the subsystem
// kDefaultSubsystem and, as category, the module (source directory) of the call.
inline constexpr char kDefaultSubsystem[] = "com.kestro.ZLKAuthentication";
std::vector<std::string> journalFields(const LogEntry& entry, const std::string& identifier);
using LogSink = std::function<void(const LogEntry&)>;
void setLogSink(LogSink sink);  // an empty function restores the backend

class Log {
 public:
  static const Log& defaultLog();  // no subsystem, no category
  // Null when a name is empty or holds control characters.
  static std::shared_ptr<const Log> create(std::string subsystem, std::string category);

  const std::string& subsystem() const { return subsystem_; }
  const std::string& category() const { return category_; }
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

  template <class T>
  requires(!std::is_same_v<T, LogArg>) LogArg(const T& v) : v_(convert(v)) {}
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

std::string formatLogMessage(std::string_view format, std::span<const LogArg> args, bool showPrivate);
// writeLog formats and writes one entry (when its level is enabled); `id` may be null.
void writeLog(const Log& log, LogLevel level, const MessageID* id, const LogFormat& format,
              std::span<const LogArg> args);

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
