#include "platform/http_message.h"

#include <strings.h>

namespace platform {

bool headerNameEquals(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

namespace {
std::optional<std::string> lookup(const HTTPHeaderFields& fields, std::string_view name) {
  std::optional<std::string> found;
  for (const auto& [k, v] : fields)
    if (headerNameEquals(k, name)) found = v;
  return found;
}

Dictionary toDictionary(const HTTPHeaderFields& fields) {
  Dictionary d;
  for (const auto& [k, v] : fields) d.insert_or_assign(k, Value(v));
  return d;
}
}  // namespace

void HTTPRequest::setValueForHTTPHeaderField(std::string value, std::string_view field) {
  for (auto& [k, v] : headerFields)
    if (headerNameEquals(k, field)) {
      v = std::move(value);
      return;
    }
  headerFields.emplace_back(std::string(field), std::move(value));
}

std::optional<std::string> HTTPRequest::valueForHTTPHeaderField(std::string_view field) const {
  return lookup(headerFields, field);
}

Dictionary HTTPRequest::allHTTPHeaderFields() const { return toDictionary(headerFields); }

std::string HTTPRequest::description() const { return "<HTTPRequest: " + HTTPMethod + " " + URL + ">"; }

std::optional<std::string> HTTPResponse::valueForHTTPHeaderField(std::string_view field) const {
  return lookup(headerFields, field);
}

Dictionary HTTPResponse::allHeaderFields() const { return toDictionary(headerFields); }

std::string HTTPResponse::description() const {
  return "<HTTPResponse: " + std::to_string(statusCode) + " " + URL + "> " + Value(allHeaderFields()).description();
}

}  // namespace platform
