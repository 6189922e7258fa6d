// What the device-services endpoints answer, before faults and transport: the setup
// certificate, the handshake, and the three token requests (signature check, body check,
// catalogue lookup, activation). Errors are answers with a JSON body {"error": "..."}:
//   400  body not JSON / not an object, a required member missing or mistyped, bad base64,
//        empty or non-base64 token item, malformed handshake request
//   401  missing "session-identifier" or "signature" header, signature not base64, unknown or
//        expired session, bad signature, replayed request
//   404  token unknown to a catalogue without a default plan
// A token request that passed verification carries its seq, and sign() makes the response
// signature over whatever body is finally sent. Thread-safe.
#pragma once

#include <openssl/evp.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "devserver/catalog.h"
#include "devserver/endpoint.h"
#include "devserver/server_stats.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace devserver {

struct Answer {
  int status = 200;
  std::string body;
  std::string contentType = "application/json";
  std::optional<uint64_t> seq;  // set when the request's signature verified
  std::string sessionIdentifier;
};

std::string errorBody(std::string_view message);
Answer errorAnswer(int status, std::string_view message);

struct SignedRequest {
  std::optional<std::string> sessionIdentifier;  // header "session-identifier"
  std::optional<std::string> signature;          // header "signature", base64
  std::string_view body;
};

class DeviceServices {
 public:
  // All references must outlive this object.
  DeviceServices(TarvexSAPServer& sap, const Catalog& catalog, EVP_PKEY* setupKey, std::chrono::seconds sessionValidity,
                 ServerStats& stats);

  Answer setupCertificate() const;
  Answer sapSession(std::string_view body);
  Answer tokenRequest(Endpoint endpoint, const SignedRequest& request);

  // The 40-byte signature of `body` as the answer to a verified request; nullopt when the
  // answer is not to a verified request or the association has gone meanwhile.
  std::optional<std::array<uint8_t, 40>> sign(const Answer& answer, std::string_view body);

 private:
  Answer verifiedTokenRequest(Endpoint endpoint, std::string_view body);
  platform::Result<const ProductPlan*> planFor(const std::vector<std::vector<uint8_t>>& tokens) const;

  TarvexSAPServer& sap_;
  const Catalog& catalog_;
  EVP_PKEY* setupKey_;
  std::chrono::seconds sessionValidity_;
  ServerStats& stats_;
};

}  // namespace devserver
