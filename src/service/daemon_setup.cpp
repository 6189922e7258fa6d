#include "service/daemon_setup.h"

#include <CLI/CLI.hpp>
#include <cstdio>
#include <fstream>
#include <sstream>

#include "platform/configuration.h"
#include "platform/device_facts.h"
#include "platform/entitlement_manifests.h"
#include "platform/listener.h"
#include "platform/log.h"
#include "platform/worker_pool.h"
#include "service/zlka_network_bus_interface.h"
#include "tarvexsap/tarvex_sap.h"

using platform::LogLevel;

namespace {

struct CommandLine {
  std::string config = platform::Configuration::kDefaultPath;
  std::string bus = "system";
  std::string logBackend;
  std::string logLevel;
  unsigned exitOnIdle = 0;
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
  app.set_version_flag("--version", std::string("zlkad ") + ZLKA_VERSION);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int status = app.exit(e);  // prints the help, the version or the mistake
    return status == 0 ? 0 : 2;
  }
  return std::nullopt;
}

std::optional<std::string> readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

}  // namespace

std::optional<int> setUpDaemon(int argc, char** argv) {
  CommandLine cl;
  if (auto status = parse(argc, argv, cl)) return status;

  std::string error;
  std::optional<platform::Configuration> config = platform::loadConfiguration(cl.config, &error);
  if (!config) {
    std::fprintf(stderr, "zlkad: %s\n", error.c_str());
    return 1;
  }
  platform::LogSettings log;
  log.minimum = cl.logLevel.empty() ? config->logLevel : *platform::logLevelFromName(cl.logLevel);
  log.privateData = config->privateData;
  log.backend = cl.logBackend == "journal" ? platform::LogBackend::Journal
                : cl.logBackend == "stderr" ? platform::LogBackend::Stderr
                                            : platform::LogBackend::Auto;
  platform::configureLog(log);
  for (const std::string& warning : config->warnings) platform::log(LogLevel::Error, "%s", warning);

  std::optional<std::string> anchor = readFile(config->trustAnchor);
  TarvexSAPConfig sap{};
  if (anchor) sap = {reinterpret_cast<const uint8_t*>(anchor->data()), anchor->size(), nullptr};
  if (!anchor || TarvexSAPConfigure(&sap) != 0) {
    std::fprintf(stderr, "zlkad: %s: sap.trust_anchor: %s is not a readable PEM certificate\n", config->path.c_str(),
                 config->trustAnchor.c_str());
    return 1;
  }

  platform::setDeviceFacts(config->device);
  platform::WorkerPool::connections().setMaximum(config->maxWorkers);
  auto manifests = std::make_shared<platform::EntitlementManifests>(config->entitlementsDirectory);
  size_t entries = manifests->reload();
  platform::log(LogLevel::Info, "Loaded %zu entitlement manifest entr(ies) from %s", entries, config->entitlementsDirectory.string());

  platform::ListenerOptions options;
  options.bus = cl.bus;
  options.serviceName = kZLKAServiceName;
  options.objectPath = kZLKAObjectPath;
  options.interface = ZLKANetworkProtocolInterface();
  options.entitlementsForPeer = [manifests](const platform::PeerCredentials& credentials) -> platform::EntitlementLookup {
    platform::PeerIdentity peer = platform::peerIdentity(credentials);
    platform::log(LogLevel::Info, "Peer pid %d uid %u label %@ runs %s", peer.pid, peer.uid, peer.label,
                  peer.executable.value_or("an executable that cannot be established"));
    return [manifests, peer = std::move(peer)](std::string_view key) { return manifests->valueFor(peer, key); };
  };
  options.onReload = [manifests] {
    size_t n = manifests->reload();
    platform::log(LogLevel::Default, "Reloaded %zu entitlement manifest entr(ies)", n);
  };
  if (cl.exitOnIdle > 0) options.exitOnIdle = std::chrono::seconds(cl.exitOnIdle);
  platform::setCurrentConfiguration(std::move(*config));
  platform::Listener::configure(std::move(options));
  return std::nullopt;
}
