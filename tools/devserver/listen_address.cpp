#include "devserver/listen_address.h"

#include <charconv>

namespace devserver {

std::optional<ListenAddress> parseListenAddress(std::string_view text) {
  const auto colon = text.rfind(':');
  if (colon == std::string_view::npos) {
    return std::nullopt;
  }
  std::string_view host = text.substr(0, colon);
  const std::string_view portText = text.substr(colon + 1);
  if (host.size() >= 2 && host.front() == '[' && host.back() == ']') {
    host = host.substr(1, host.size() - 2);
  } else if (host.find(':') != std::string_view::npos) {
    return std::nullopt;  // an IPv6 address needs its brackets
  }
  if (host.empty() || host.find_first_of("[] \t") != std::string_view::npos || portText.empty() ||
      portText.size() > 5) {
    return std::nullopt;
  }
  unsigned port = 0;
  const auto [end, error] = std::from_chars(portText.data(), portText.data() + portText.size(), port);
  if (error != std::errc() || end != portText.data() + portText.size() || port > 65535) {
    return std::nullopt;
  }
  return ListenAddress{std::string(host), static_cast<uint16_t>(port)};
}

std::string urlHost(std::string_view host) {
  if (host == "0.0.0.0") {
    return "127.0.0.1";
  }
  if (host == "::") {
    return "[::1]";
  }
  if (host.find(':') != std::string_view::npos) {
    return "[" + std::string(host) + "]";
  }
  return std::string(host);
}

}  // namespace devserver
