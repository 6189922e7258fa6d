// The five device-services endpoints: their names (as used by the admin interface and the
// statistics), their paths and their HTTP methods.
#pragma once

#include <array>
#include <optional>
#include <string_view>

namespace devserver {

enum class Endpoint { setupCertificate, sapSession, queryProductPlan, activateAccessory, ackAccessory };

inline constexpr std::array<Endpoint, 5> kAllEndpoints = {Endpoint::setupCertificate, Endpoint::sapSession,
                                                          Endpoint::queryProductPlan, Endpoint::activateAccessory,
                                                          Endpoint::ackAccessory};

// "setup.crt", "sapSession", "queryProductPlan", "activateAccessory", "ackAccessory".
std::string_view endpointName(Endpoint endpoint);
std::optional<Endpoint> endpointNamed(std::string_view name);
// "/deviceservices/" + name; nullopt for any other path.
std::optional<Endpoint> endpointAtPath(std::string_view path);
// "GET" for the certificate, "POST" for the others.
std::string_view endpointMethod(Endpoint endpoint);
// The three that carry signed requests.
bool isTokenEndpoint(Endpoint endpoint);

}  // namespace devserver
