#include "service/daemon_setup.h"

#include <CLI/CLI.hpp>

#include "platform/config/configuration.h"
#include "platform/config/device_facts.h"
#include "platform/dispatch/worker_pool.h"
#include "platform/listener/entitlement_manifests.h"
#include "platform/listener/listener.h"
#include "platform/log/log.h"
#include "service/config_check.h"
#include "service/runtime_control.h"
#include "service/zlka_network_bus_interface.h"

using platform::LogLevel;

namespace {

struct CommandLine {
  std::string config = platform::Configuration::kDefaultPath;
  std::string bus = "system";
  std::string logBackend;
  std::string logLevel;
  unsigned exitOnIdle = 0;
  bool checkConfig = false;
};

std::optional<int> parse(int argc, char** argv, CommandLine& cl) {
  CLI::App app{
      "zlkad: authenticates hardware accessories for local clients over D-Bus.\n"
      "Serves com.kestro.ZLKAuthentication.ZLKANetwork; each call is one signed HTTPS request to the "
      "device-services server named in the configuration file.",
      "zlkad"};
  app.add_option("--config", cl.config, "Configuration file")->capture_default_str();
  app.add_option("--bus", cl.bus, "Bus to serve on: system, session, or a bus address such as unix:path=/run/x")
      ->capture_default_str();
  app.add_option("--log", cl.logBackend, "Where log entries go (default: the journal when stderr is connected to it)")
      ->check(CLI::IsMember({"journal", "stderr"}));
  app.add_option("--log-level", cl.logLevel, "Lowest level written; overrides log.level of the configuration")
      ->check(CLI::IsMember({"debug", "info", "default", "error", "fault"}))
      ->multi_option_policy(CLI::MultiOptionPolicy::TakeLast);
  app.add_option("--exit-on-idle", cl.exitOnIdle,
                 "Exit after this many seconds with no call in flight and no new call (0: never)")
      ->check(CLI::Range(0u, 86400u * 365u));
  app.add_flag("--check-config", cl.checkConfig,
               "Check the configuration and the files it names, then exit: 0 when zlkad could start with it, " +
                   std::to_string(kExitConfiguration) + " when not. Touches no bus.");
  app.set_version_flag("--version", std::string("zlkad ") + ZLKA_VERSION);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int status = app.exit(e);  // prints the help, the version or the mistake
    return status == 0 ? 0 : kExitUsage;
  }
  return std::nullopt;
}

// The log as the command line asks for it; the file's level follows once the file is read.
void configureLogFromCommandLine(const CommandLine& cl) {
  platform::LogSettings log;
  if (!cl.logLevel.empty()) log.minimum = *platform::logLevelFromName(cl.logLevel);
  log.backend = cl.logBackend == "journal"  ? platform::LogBackend::Journal
                : cl.logBackend == "stderr" ? platform::LogBackend::Stderr
                                            : platform::LogBackend::Auto;
  platform::configureLog(log);
}

}  // namespace

std::optional<int> setUpDaemon(int argc, char** argv) {
  CommandLine cl;
  if (auto status = parse(argc, argv, cl)) return status;
  configureLogFromCommandLine(cl);

  // Fatal problems go out at error priority through the log, where `journalctl -p err` finds them.
  platform::Result<platform::Configuration> config = platform::loadConfiguration(cl.config);
  if (!config) {
    platform::log(LogLevel::Error, "%s", config.error());
    return kExitConfiguration;
  }
  platform::LogSettings log = platform::currentLogSettings();
  if (cl.logLevel.empty()) log.minimum = config->logLevel;
  log.privateData = config->privateData;
  platform::configureLog(log);
  for (const std::string& warning : config->warnings) platform::log(LogLevel::Error, "%s", warning);
  std::vector<std::string> problems = startUpProblems(*config);
  for (const std::string& problem : problems) platform::log(LogLevel::Error, "%s", problem);
  if (!problems.empty()) return kExitConfiguration;

  platform::setDeviceFacts(config->device);
  platform::WorkerPool::connections().setMaximum(config->maxWorkers);
  auto manifests = std::make_shared<platform::EntitlementManifests>(config->entitlementsDirectory);
  size_t entries = manifests->reload();
  platform::log(LogLevel::Info, "Loaded %zu entitlement manifest entr(ies) from %s", entries,
                config->entitlementsDirectory.string());
  if (cl.checkConfig) {
    // At start an unusable manifest is only ignored; a check says so, since no caller it names gets in.
    size_t files = manifestFileCount(config->entitlementsDirectory);
    if (entries < files) {
      platform::log(LogLevel::Error, "%s: %zu of %zu entitlement manifest(s) ignored (see above)",
                    config->path.string(), files - entries, files);
      return kExitConfiguration;
    }
    platform::log(LogLevel::Default, "%s: the configuration is usable", config->path.string());
    return 0;
  }

  platform::ListenerOptions options;
  options.bus = cl.bus;
  options.serviceName = kZLKAServiceName;
  options.objectPath = kZLKAObjectPath;
  options.interface = ZLKANetworkProtocolInterface();
  options.entitlementsForPeer =
      [manifests](const platform::PeerCredentials& credentials) -> platform::EntitlementLookup {
    platform::PeerIdentity peer = platform::peerIdentity(credentials);
    platform::log(LogLevel::Info, "Peer pid %d uid %u label %@ runs %s", peer.pid, peer.uid, peer.label,
                  peer.executable.value_or("an executable that cannot be established"));
    return [manifests, peer = std::move(peer)](std::string_view key) { return manifests->valueFor(peer, key); };
  };
  RuntimeOptions runtime;
  runtime.configPath = config->path;
  runtime.levelFromCommandLine = !cl.logLevel.empty();
  runtime.reloadManifests = [manifests] {
    size_t n = manifests->reload();
    platform::log(LogLevel::Default, "Reloaded %zu entitlement manifest entr(ies)", n);
  };
  auto control = std::make_shared<std::weak_ptr<RuntimeControl>>();
  options.onServing = [control, runtime](sd_bus* bus, sd_event* event) -> std::shared_ptr<void> {
    std::shared_ptr<RuntimeControl> started = RuntimeControl::start(bus, event, runtime);
    *control = started;
    return started;
  };
  options.onReload = [control, reloadManifests = runtime.reloadManifests] {
    if (auto c = control->lock())
      c->reload();
    else
      reloadManifests();
  };
  options.drainLimit = kDrainLimit;
  if (cl.exitOnIdle > 0) options.exitOnIdle = std::chrono::seconds(cl.exitOnIdle);
  platform::setCurrentConfiguration(std::move(*config));
  platform::Listener::configure(std::move(options));
  return std::nullopt;
}
