#include "bench_world.h"

#include <signal.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "platform/config/configuration.h"
#include "platform/config/device_facts.h"
#include "platform/log/log.h"
#include "tarvexsap/tarvex_sap.h"

namespace netbench {

namespace fs = std::filesystem;

BenchWorld::BenchWorld() {
  signal(SIGPIPE, SIG_IGN);
  std::string pattern = (fs::temp_directory_path() / "zlka-network-bench-XXXXXX").string();
  if (!mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp failed");
  tempDir_ = pattern;
  stateDir_ = tempDir_ / "state";

  devserver::DevServerOptions options;
  options.stateDir = stateDir_;
  server_ = std::make_unique<devserver::DevServer>(options);
  if (auto error = server_->start()) throw std::runtime_error("zlka-devserver did not start: " + *error);

  auto configuration = platform::loadConfiguration(stateDir_ / "zlkad.toml");
  if (!configuration) throw std::runtime_error(configuration.error());
  platform::setCurrentConfiguration(*configuration);
  platform::setDeviceFacts(configuration->device);

  std::ifstream in(configuration->trustAnchor, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  trustAnchor_ = std::move(text).str();
  const TarvexSAPConfig sap{reinterpret_cast<const uint8_t*>(trustAnchor_.data()), trustAnchor_.size(), nullptr};
  if (TarvexSAPConfigure(&sap) != kTarvexSAPOK) throw std::runtime_error("TarvexSAPConfigure failed");

  // The operations log every request at default level: measure them, not the log.
  platform::LogSettings quiet = platform::currentLogSettings();
  quiet.minimum = platform::LogLevel::Fault;
  platform::configureLog(quiet);
  platform::setLogSink([](const platform::LogEntry&) {});
}

BenchWorld::~BenchWorld() {
  server_->stop();
  std::error_code ignored;
  fs::remove_all(tempDir_, ignored);
}

}  // namespace netbench
