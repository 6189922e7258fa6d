// HTTP requests and responses as the HTTP session takes and gives them. Header names compare
// without regard to case; a request keeps its headers in the order they were set.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/value.h"

namespace platform {

using HTTPHeaderFields = std::vector<std::pair<std::string, std::string>>;

struct HTTPRequest {
  std::string URL;
  std::string HTTPMethod = "GET";
  HTTPHeaderFields headerFields;
  double timeoutInterval = 60.0;  // seconds for the whole exchange
  int cachePolicy = 0;            // the protocol's own caching rules (nothing is cached here)

  HTTPRequest() = default;
  HTTPRequest(std::string url, int cachePolicy, double timeoutInterval)
      : URL(std::move(url)), timeoutInterval(timeoutInterval), cachePolicy(cachePolicy) {}

  void setValueForHTTPHeaderField(std::string value, std::string_view field);  // replaces an existing one
  std::optional<std::string> valueForHTTPHeaderField(std::string_view field) const;
  Dictionary allHTTPHeaderFields() const;
  std::string description() const;  // "<HTTPRequest: POST https://host/path>"
};

struct HTTPResponse {
  std::string URL;
  long statusCode = 0;
  HTTPHeaderFields headerFields;  // as received, last value wins on lookup

  std::optional<std::string> valueForHTTPHeaderField(std::string_view field) const;
  Dictionary allHeaderFields() const;
  std::string description() const;  // "<HTTPResponse: 200 https://host/path> {headers}"
};

bool headerNameEquals(std::string_view a, std::string_view b);

}  // namespace platform
