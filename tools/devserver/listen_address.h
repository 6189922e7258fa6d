// The --listen argument: "HOST:PORT", with IPv6 hosts in brackets ("[::1]:8443"). Port 0 asks
// for a free port. urlHost() is the host as it goes into a URL: a wildcard address becomes the
// matching loopback address (what a local client connects to), IPv6 gets its brackets back.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace devserver {

struct ListenAddress {
  std::string host;
  uint16_t port = 0;
};

// nullopt when the text is not HOST:PORT with a non-empty host and a port of 0 to 65535.
std::optional<ListenAddress> parseListenAddress(std::string_view text);

std::string urlHost(std::string_view host);

}  // namespace devserver
