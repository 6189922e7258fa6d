// A private D-Bus daemon for one test: started from a temporary configuration that lets anyone
// own any name, stopped (by its pid) when the object goes away. With `anyUser`, processes of every
// user in the user database may connect, as on the system bus.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <string>

namespace client_test {

class PrivateBus {
 public:
  // Fails the current test (ADD_FAILURE) when the daemon does not start.
  explicit PrivateBus(bool anyUser = false);
  ~PrivateBus();
  PrivateBus(const PrivateBus&) = delete;
  PrivateBus& operator=(const PrivateBus&) = delete;

  bool running() const { return !address_.empty(); }
  const std::string& address() const { return address_; }  // "unix:path=...,guid=..."

 private:
  std::filesystem::path directory_;
  std::string address_;
  pid_t pid_ = -1;
};

}  // namespace client_test
