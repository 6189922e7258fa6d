// RuntimeControl: what an operator watches and changes while zlkad runs, without a restart (a
// restart drops the open session). On the listener's loop, it serves:
//   org.freedesktop.LogControl1 at /org/freedesktop/LogControl1: LogLevel and LogTarget, writable
//     by root only, and SyslogIdentifier;
//   read-only properties of the service object: Version, SessionState, SessionTimeToLive,
//     CallsInFlight and Answers (answers counted by outcome);
//   STATUS= for systemd, rewritten when what it says changes (checked once a second), and the
//     watchdog, fed by the loop itself so that a stuck loop gets the daemon restarted;
//   reload (SIGHUP): RELOADING=1, log.level and log.private_data read again, the entitlement
//     manifests read again, READY=1. Other keys need a restart.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/bus/handles.h"
#include "platform/listener/bus_properties.h"
#include "platform/log/log.h"

inline constexpr char kLogControlPath[] = "/org/freedesktop/LogControl1";
inline constexpr char kLogControlInterface[] = "org.freedesktop.LogControl1";

struct RuntimeOptions {
  std::filesystem::path configPath;
  bool levelFromCommandLine = false;  // --log-level wins over log.level, on reload too
  std::function<void()> reloadManifests;
  bool notify = true;  // talk to systemd through sd_notify
};

class RuntimeControl {
 public:
  // start exports the properties on `bus` and starts the status timer and the watchdog on
  // `event` (bus thread). It returns the control, which stops all that when released, or null
  // (having logged why) when sd-bus refuses the properties.
  static std::shared_ptr<RuntimeControl> start(sd_bus* bus, sd_event* event, RuntimeOptions options);

  // reload applies what SIGHUP changes (bus thread); a configuration that no longer loads is
  // logged and leaves the running settings as they are.
  void reload();

 private:
  struct Private {};

 public:
  // Only start() can call this, through make_shared; it exports nothing by itself.
  RuntimeControl(Private, RuntimeOptions options) : options_(std::move(options)) {}

 private:
  static int onTick(sd_event_source* source, uint64_t, void* userdata);
  void tick();
  std::optional<platform::BusError> setLogLevel(sd_bus_message* value);
  std::optional<platform::BusError> setLogTarget(sd_bus_message* value);

  RuntimeOptions options_;
  std::unique_ptr<platform::BusProperties> properties_;
  platform::EventSourcePtr timer_;
  std::string status_;
  std::string sessionState_ = "closed";
};

// The LogControl1 level names ("emerg" .. "debug") for the daemon's levels: fault reads as "crit",
// error as "err", default as "notice"; emerg, alert and crit set fault, warning sets default.
std::optional<platform::LogLevel> logLevelFromSyslogName(std::string_view name);
std::string_view syslogNameOfLogLevel(platform::LogLevel level);
