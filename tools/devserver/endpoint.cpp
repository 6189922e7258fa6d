#include "devserver/endpoint.h"

namespace devserver {

std::string_view endpointName(Endpoint endpoint) {
  switch (endpoint) {
    case Endpoint::setupCertificate:
      return "setup.crt";
    case Endpoint::sapSession:
      return "sapSession";
    case Endpoint::queryProductPlan:
      return "queryProductPlan";
    case Endpoint::activateAccessory:
      return "activateAccessory";
    case Endpoint::ackAccessory:
      return "ackAccessory";
  }
  return "";
}

std::optional<Endpoint> endpointNamed(std::string_view name) {
  for (const Endpoint endpoint : kAllEndpoints) {
    if (endpointName(endpoint) == name) {
      return endpoint;
    }
  }
  return std::nullopt;
}

std::optional<Endpoint> endpointAtPath(std::string_view path) {
  constexpr std::string_view kPrefix = "/deviceservices/";
  if (!path.starts_with(kPrefix)) {
    return std::nullopt;
  }
  return endpointNamed(path.substr(kPrefix.size()));
}

std::string_view endpointMethod(Endpoint endpoint) { return endpoint == Endpoint::setupCertificate ? "GET" : "POST"; }

bool isTokenEndpoint(Endpoint endpoint) {
  return endpoint == Endpoint::queryProductPlan || endpoint == Endpoint::activateAccessory ||
         endpoint == Endpoint::ackAccessory;
}

}  // namespace devserver
