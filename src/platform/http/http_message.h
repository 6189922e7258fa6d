// HTTP requests and responses as the HTTP session takes and gives them. Header names compare
// without regard to case; a request keeps its headers in the order they were set.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/values/value.h"

namespace platform {

using HTTPHeaderFields = std::vector<std::pair<std::string, std::string>>;

struct HTTPRequest {
  std::string URL;
  std::string HTTPMethod = "GET";
  HTTPHeaderFields headerFields;
  double timeoutInterval = 60.0;  // seconds for the whole exchange
  int cachePolicy = 0;            // the protocol's own caching rules (nothing is cached here)

  HTTPRequest() = default;
  // HTTPRequest makes a GET of `url` with no headers, the given cache policy and time-out (seconds).
  HTTPRequest(std::string url, int cachePolicy, double timeoutInterval)
      : URL(std::move(url)), timeoutInterval(timeoutInterval), cachePolicy(cachePolicy) {}

  // setValueForHTTPHeaderField sets the header `field` to `value`, in the place of an existing one
  // of that name, else at the end.
  void setValueForHTTPHeaderField(std::string value, std::string_view field);
  // valueForHTTPHeaderField is the value of the header `field`, or nullopt when it is not set.
  std::optional<std::string> valueForHTTPHeaderField(std::string_view field) const;
  // allHTTPHeaderFields is a copy of the headers, name to value, names as they were set.
  Dictionary allHTTPHeaderFields() const;
  // description renders the request for logs: "<HTTPRequest: POST https://host/path>".
  std::string description() const;
};

struct HTTPResponse {
  std::string URL;
  long statusCode = 0;
  HTTPHeaderFields headerFields;  // as received, last value wins on lookup

  // valueForHTTPHeaderField is the last value received for `field`, or nullopt when there is none.
  std::optional<std::string> valueForHTTPHeaderField(std::string_view field) const;
  // allHeaderFields is a copy of the headers, name (as received) to its last value.
  Dictionary allHeaderFields() const;
  // description renders the response for logs: "<HTTPResponse: 200 https://host/path> {headers}".
  std::string description() const;
};

// headerNameEquals is true when `a` and `b` are the same header name, ignoring ASCII case.
bool headerNameEquals(std::string_view a, std::string_view b);

}  // namespace platform
