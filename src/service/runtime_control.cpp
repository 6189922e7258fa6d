#include "service/runtime_control.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>

#include <cmath>
#include <cstdlib>
#include <cstring>

#include "network/zlka_network.h"
#include "platform/config/configuration.h"
#include "platform/listener/listener.h"
#include "service/answer_counts.h"
#include "service/zlka_network_bus_interface.h"

using platform::BusError;
using platform::BusProperty;
using platform::LogLevel;
using platform::PropertyChanges;

namespace {

// Once a second costs nothing measurable: a few atomic reads, and a datagram only when the text
// changed (the time to live counts in minutes, so about once a minute while a session is open).
constexpr uint64_t kTickUsec = 1000000;

// Tells the service manager `message` as sd_notify does, but this runs on the bus thread, which
// must never wait: sd_notify blocks while the manager's queue is full, so a message that does not
// fit now is dropped instead (the next change of status sends the status again).
void notifyWithoutWaiting(const std::string& message) {
  const char* path = std::getenv("NOTIFY_SOCKET");
  if (!path || (path[0] != '/' && path[0] != '@')) return;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const size_t length = std::strlen(path);
  if (length >= sizeof address.sun_path) return;
  std::memcpy(address.sun_path, path, length);
  if (path[0] == '@') address.sun_path[0] = '\0';  // an abstract socket
  platform::UniqueFd fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) return;
  const auto size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length);
  if (::sendto(fd.get(), message.data(), message.size(), MSG_NOSIGNAL | MSG_DONTWAIT,
               reinterpret_cast<const sockaddr*>(&address), size) < 0)
    platform::log(LogLevel::Debug, "The service manager did not take %s: %s", message,
                  std::string(std::strerror(errno)));
}

struct SessionView {
  std::string state = "closed";  // "closed", "opening", "open"
  uint64_t secondsToLive = 0;
};

// Never makes the shared ZLKANetwork: before the first caller there is no session to report.
SessionView sessionView() {
  SessionView view;
  std::shared_ptr<ZLKANetwork> network = ZLKANetwork::existingInstance();
  std::shared_ptr<TarvexSAPSession> session = network ? network->tarvexSAPSession() : nullptr;
  if (!session) return view;
  switch (session->observedState()) {
    case TarvexSAPSessionStateClosed:
      break;
    case TarvexSAPSessionStateInitializing:
      view.state = "opening";
      break;
    case TarvexSAPSessionStateOpen:
      view.state = "open";
      view.secondsToLive = static_cast<uint64_t>(std::max(0.0, std::floor(session->observedTTL())));
      break;
  }
  return view;
}

size_t callsInFlight() { return platform::Listener::serviceListener().callsInFlight(); }

std::string statusText() {
  SessionView session = sessionView();
  std::string text = "Serving; " + std::to_string(callsInFlight()) + " call(s) in flight; session " + session.state;
  if (session.state == "open") text += ", " + std::to_string((session.secondsToLive + 59) / 60) + " min to live";
  return text;
}

int appendString(sd_bus_message* reply, const std::string& s) { return sd_bus_message_append(reply, "s", s.c_str()); }

std::optional<std::string> readString(sd_bus_message* value) {
  const char* s = nullptr;
  if (sd_bus_message_read_basic(value, 's', &s) < 0 || !s) return std::nullopt;
  return s;
}

int appendAnswers(sd_bus_message* reply) {
  int r = sd_bus_message_open_container(reply, 'a', "{st}");
  for (const auto& [name, count] : answerCounts().counts())
    if (r >= 0) r = sd_bus_message_append(reply, "{st}", name.c_str(), count);
  return r < 0 ? r : sd_bus_message_close_container(reply);
}

uint64_t monotonicUsec() {
  timespec t{};
  clock_gettime(CLOCK_MONOTONIC, &t);
  return static_cast<uint64_t>(t.tv_sec) * 1000000u + static_cast<uint64_t>(t.tv_nsec) / 1000u;
}

}  // namespace

std::optional<LogLevel> logLevelFromSyslogName(std::string_view name) {
  if (name == "emerg" || name == "alert" || name == "crit") return LogLevel::Fault;
  if (name == "err") return LogLevel::Error;
  if (name == "warning" || name == "notice") return LogLevel::Default;
  if (name == "info") return LogLevel::Info;
  if (name == "debug") return LogLevel::Debug;
  return std::nullopt;
}

std::string_view syslogNameOfLogLevel(LogLevel level) {
  switch (level) {
    case LogLevel::Fault:
      return "crit";
    case LogLevel::Error:
      return "err";
    case LogLevel::Default:
      return "notice";
    case LogLevel::Info:
      return "info";
    case LogLevel::Debug:
      return "debug";
  }
  return "notice";
}

std::shared_ptr<RuntimeControl> RuntimeControl::start(sd_bus* bus, sd_event* event, RuntimeOptions options) {
  auto control = std::make_shared<RuntimeControl>(Private{}, std::move(options));
  RuntimeControl* self = control.get();  // the properties and the timer go before the control does
  // clang-format off
  std::vector<platform::PropertyInterface> interfaces = {
      {kZLKAObjectPath,
       kZLKAInterfaceName,
       {
           {"Version", "s", [](sd_bus_message* r) { return sd_bus_message_append(r, "s", ZLKA_VERSION); }, {},
            PropertyChanges::Const},
           {"SessionState", "s", [](sd_bus_message* r) { return appendString(r, sessionView().state); }, {},
            PropertyChanges::Emits},
           {"SessionTimeToLive", "t",
            [](sd_bus_message* r) { return sd_bus_message_append(r, "t", sessionView().secondsToLive); }, {},
            PropertyChanges::None},
           {"CallsInFlight", "u",
            [](sd_bus_message* r) { return sd_bus_message_append(r, "u", static_cast<uint32_t>(callsInFlight())); },
            {}, PropertyChanges::None},
           {"Answers", "a{st}", appendAnswers, {}, PropertyChanges::None},
       }},
      {kLogControlPath,
       kLogControlInterface,
       {
           {"LogLevel", "s",
            [](sd_bus_message* r) {
              return appendString(r, std::string(syslogNameOfLogLevel(platform::currentLogSettings().minimum)));
            },
            [self](sd_bus_message* v) { return self->setLogLevel(v); }, PropertyChanges::Emits},
           {"LogTarget", "s",
            [](sd_bus_message* r) { return appendString(r, platform::logGoesToJournal() ? "journal" : "console"); },
            [self](sd_bus_message* v) { return self->setLogTarget(v); }, PropertyChanges::Emits},
           {"SyslogIdentifier", "s",
            [](sd_bus_message* r) { return appendString(r, platform::currentLogSettings().identifier); }, {},
            PropertyChanges::Const},
       }},
  };
  // clang-format on
  platform::Result<std::unique_ptr<platform::BusProperties>> exported =
      platform::BusProperties::exportOn(bus, std::move(interfaces));
  if (!exported) {
    platform::log(LogLevel::Error, "Runtime control is not available: %s", exported.error());
    return nullptr;
  }
  control->properties_ = *std::move(exported);

  sd_event_source* timer = nullptr;
  if (sd_event_add_time_relative(event, &timer, CLOCK_MONOTONIC, kTickUsec, kTickUsec / 10, &RuntimeControl::onTick,
                                 self) >= 0) {
    control->timer_.reset(timer);
    sd_event_source_set_enabled(timer, SD_EVENT_ON);
  }
  // The loop pings the watchdog itself (at half of WatchdogSec), so a loop that hangs is restarted.
  if (sd_event_set_watchdog(event, 1) > 0) platform::log(LogLevel::Info, "The event loop keeps the watchdog fed");
  return control;
}

int RuntimeControl::onTick(sd_event_source* source, uint64_t, void* userdata) {
  static_cast<RuntimeControl*>(userdata)->tick();
  sd_event_source_set_time_relative(source, kTickUsec);
  return 0;
}

void RuntimeControl::tick() {
  std::string state = sessionView().state;
  if (state != sessionState_) {
    sessionState_ = state;
    properties_->changed(kZLKAObjectPath, kZLKAInterfaceName, {"SessionState"});
  }
  std::string status = statusText();
  if (options_.notify && status != status_) notifyWithoutWaiting("STATUS=" + status);
  status_ = std::move(status);
}

std::optional<BusError> RuntimeControl::setLogLevel(sd_bus_message* value) {
  std::optional<std::string> name = readString(value);
  std::optional<LogLevel> level = name ? logLevelFromSyslogName(*name) : std::nullopt;
  if (!level)
    return BusError{platform::kBusErrorInvalidArgs,
                    "Unknown log level '" + name.value_or("") +
                        "': expected emerg, alert, crit, err, warning, notice, info or debug."};
  platform::LogSettings settings = platform::currentLogSettings();
  settings.minimum = *level;
  platform::configureLog(settings);
  platform::log(LogLevel::Default, "Log level set to %s over D-Bus", platform::logLevelName(*level));
  properties_->changed(kLogControlPath, kLogControlInterface, {"LogLevel"});
  return std::nullopt;
}

std::optional<BusError> RuntimeControl::setLogTarget(sd_bus_message* value) {
  std::optional<std::string> name = readString(value);
  platform::LogSettings settings = platform::currentLogSettings();
  if (name == "journal")
    settings.backend = platform::LogBackend::Journal;
  else if (name == "console")
    settings.backend = platform::LogBackend::Stderr;
  else if (name == "auto")
    settings.backend = platform::LogBackend::Auto;
  else
    return BusError{platform::kBusErrorInvalidArgs,
                    "Unsupported log target '" + name.value_or("") + "': expected journal, console or auto."};
  platform::configureLog(settings);
  platform::log(LogLevel::Default, "Log target set to %s over D-Bus", *name);
  properties_->changed(kLogControlPath, kLogControlInterface, {"LogTarget"});
  return std::nullopt;
}

void RuntimeControl::reload() {
  if (options_.notify) notifyWithoutWaiting("RELOADING=1\nMONOTONIC_USEC=" + std::to_string(monotonicUsec()));
  platform::Result<platform::Configuration> config = platform::loadConfiguration(options_.configPath);
  if (!config) {
    platform::log(LogLevel::Error, "Keeping the running log settings: %s", config.error());
  } else {
    platform::LogSettings settings = platform::currentLogSettings();
    LogLevel before = settings.minimum;
    if (!options_.levelFromCommandLine) settings.minimum = config->logLevel;
    settings.privateData = config->privateData;
    platform::configureLog(settings);
    platform::log(LogLevel::Default, "Log level %s, private data %s; keys other than log.* apply at the next start",
                  platform::logLevelName(settings.minimum), settings.privateData ? "shown" : "redacted");
    if (settings.minimum != before) properties_->changed(kLogControlPath, kLogControlInterface, {"LogLevel"});
  }
  if (options_.reloadManifests) options_.reloadManifests();
  status_ = statusText();
  if (options_.notify) notifyWithoutWaiting("READY=1\nSTATUS=" + status_);
}
