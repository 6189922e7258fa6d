// What the network benchmarks run against: zlka-devserver on loopback in this process, the
// configuration it writes (a production device), the session library's trust anchor, and a log
// that keeps quiet.
#pragma once

#include <filesystem>
#include <memory>
#include <string>

#include "devserver/dev_server.h"

namespace netbench {

class BenchWorld {
 public:
  // Starts the server and configures the process; throws std::runtime_error on failure.
  BenchWorld();
  ~BenchWorld();
  BenchWorld(const BenchWorld&) = delete;
  BenchWorld& operator=(const BenchWorld&) = delete;

  std::string baseURL() const { return server_->baseURL(); }
  std::filesystem::path caFile() const { return stateDir_ / "ca.pem"; }
  std::string trustAnchorPEM() const { return trustAnchor_; }

 private:
  std::filesystem::path tempDir_;
  std::filesystem::path stateDir_;
  std::unique_ptr<devserver::DevServer> server_;
  std::string trustAnchor_;
};

}  // namespace netbench
