#include "devserver/device_services.h"

#include <nlohmann/json.hpp>
#include <span>

#include "devserver/activation_token.h"
#include "devserver/strict_base64.h"

namespace devserver {

using nlohmann::json;

namespace {

std::span<const uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

// Every text in an answer came from parsed JSON; replacing stray bytes keeps dump() total.
std::string serialise(const json& value) { return value.dump(-1, ' ', false, json::error_handler_t::replace); }

// What the server's own failure (of the crypto library) answers, as the dispatcher answers
// any other.
Answer internalError(const std::string& why) { return errorAnswer(500, "internal error: " + why); }

Answer jsonAnswer(int status, const json& value) {
  Answer answer;
  answer.status = status;
  answer.body = serialise(value);
  return answer;
}

const char* rejectionReason(TarvexSAPServerStatus status) {
  switch (status) {
    case TarvexSAPServerStatus::unknownSession:
      return "unknown session";
    case TarvexSAPServerStatus::expired:
      return "session expired";
    case TarvexSAPServerStatus::badSignature:
      return "bad signature";
    case TarvexSAPServerStatus::replay:
      return "replayed request";
    default:
      return "request not verified";
  }
}

// The members that all three token requests share.
struct TokenBody {
  json document;
  std::vector<std::vector<uint8_t>> tokens;
  std::string uuid;
};

std::optional<Answer> parseTokenBody(std::string_view body, TokenBody& out) {
  out.document = json::parse(body, nullptr, false);
  if (out.document.is_discarded()) {
    return errorAnswer(400, "body is not JSON");
  }
  if (!out.document.is_object()) {
    return errorAnswer(400, "body is not a JSON object");
  }
  const auto tokens = out.document.find("tokens");
  if (tokens == out.document.end() || !tokens->is_array() || tokens->empty()) {
    return errorAnswer(400, "\"tokens\" must be a non-empty array of base64 strings");
  }
  for (std::size_t i = 0; i < tokens->size(); ++i) {
    const json& item = (*tokens)[i];
    std::optional<std::vector<uint8_t>> bytes;
    if (item.is_string()) {
      bytes = base64DecodeStrict(item.get_ref<const std::string&>());
    }
    if (!bytes || bytes->empty()) {
      return errorAnswer(400, "\"tokens\"[" + std::to_string(i) + "] is not a non-empty base64 string");
    }
    out.tokens.push_back(std::move(*bytes));
  }
  const auto uuid = out.document.find("uuid");
  if (uuid == out.document.end() || !uuid->is_string()) {
    return errorAnswer(400, "\"uuid\" must be a string");
  }
  out.uuid = uuid->get<std::string>();
  return std::nullopt;
}

}  // namespace

std::string errorBody(std::string_view message) { return serialise(json{{"error", message}}); }

Answer errorAnswer(int status, std::string_view message) {
  Answer answer;
  answer.status = status;
  answer.body = errorBody(message);
  return answer;
}

DeviceServices::DeviceServices(TarvexSAPServer& sap, const Catalog& catalog, EVP_PKEY* setupKey,
                               std::chrono::seconds sessionValidity, ServerStats& stats)
    : sap_(sap), catalog_(catalog), setupKey_(setupKey), sessionValidity_(sessionValidity), stats_(stats) {}

Answer DeviceServices::setupCertificate() const {
  Answer answer;
  const auto& der = sap_.setupCertificateDER();
  answer.body.assign(der.begin(), der.end());
  answer.contentType = "application/pkix-cert";
  return answer;
}

Answer DeviceServices::sapSession(std::string_view body) {
  const json document = json::parse(body, nullptr, false);
  if (document.is_discarded()) {
    return errorAnswer(400, "body is not JSON");
  }
  if (!document.is_object()) {
    return errorAnswer(400, "body is not a JSON object");
  }
  const auto request = document.find("session-request");
  if (request == document.end() || !request->is_string()) {
    return errorAnswer(400, "\"session-request\" must be a base64 string");
  }
  const auto identifier = document.find("session-identifier");
  if (identifier == document.end() || !identifier->is_string()) {
    return errorAnswer(400, "\"session-identifier\" must be a string");
  }
  const auto requestBytes = base64DecodeStrict(request->get_ref<const std::string&>());
  if (!requestBytes) {
    return errorAnswer(400, "\"session-request\" is not base64");
  }
  sap_.dropExpired();  // keeps the association table bounded by live sessions
  const auto result = sap_.handshake(identifier->get_ref<const std::string&>(), *requestBytes, sessionValidity_);
  if (result.status == TarvexSAPServerStatus::malformed) {
    return errorAnswer(400, "malformed handshake request");
  }
  if (result.status != TarvexSAPServerStatus::ok) {
    return errorAnswer(500, "handshake failed");
  }
  stats_.countHandshake();
  return jsonAnswer(
      200, json{{"session-info", base64Encode(result.sessionInfo)}, {"session-validity", sessionValidity_.count()}});
}

Answer DeviceServices::tokenRequest(Endpoint endpoint, const SignedRequest& request) {
  const auto reject = [this](std::string_view reason) {
    stats_.countRejected();
    return errorAnswer(401, reason);
  };
  if (!request.sessionIdentifier) {
    return reject("missing session-identifier header");
  }
  if (!request.signature) {
    return reject("missing signature header");
  }
  const auto signature = base64DecodeStrict(*request.signature);
  if (!signature) {
    return reject("signature header is not base64");
  }
  const auto verified = sap_.verifyRequest(*request.sessionIdentifier, *signature, bytesOf(request.body));
  if (verified.status == TarvexSAPServerStatus::cryptoFailure) {
    return errorAnswer(500, "signature check failed");
  }
  if (verified.status != TarvexSAPServerStatus::ok) {
    return reject(rejectionReason(verified.status));
  }
  stats_.countVerified();
  Answer answer = verifiedTokenRequest(endpoint, request.body);
  answer.seq = verified.seq;
  answer.sessionIdentifier = *request.sessionIdentifier;
  return answer;
}

Answer DeviceServices::verifiedTokenRequest(Endpoint endpoint, std::string_view body) {
  TokenBody request;
  if (auto bad = parseTokenBody(body, request)) {
    return std::move(*bad);
  }
  if (endpoint == Endpoint::ackAccessory) {
    Answer answer;
    answer.status = 204;
    return answer;
  }
  std::string locale;
  if (endpoint == Endpoint::queryProductPlan) {
    const auto requested = request.document.find("locale");
    if (requested == request.document.end() || !requested->is_string()) {
      return errorAnswer(400, "\"locale\" must be a string");
    }
    const auto info = request.document.find("request_info");
    if (info != request.document.end() && !info->is_object()) {
      return errorAnswer(400, "\"request_info\" must be an object");
    }
    locale = requested->get<std::string>();
  }
  const platform::Result<const ProductPlan*> found = planFor(request.tokens);
  if (!found) {
    return internalError(found.error());
  }
  const ProductPlan* plan = *found;
  if (plan == nullptr) {
    return errorAnswer(404, "unknown token");
  }
  if (endpoint == Endpoint::queryProductPlan) {
    const std::string answered = plan->answerLocale(locale);
    return jsonAnswer(200,
                      json{{"ppid", plan->ppid}, {"locale", answered}, {"ppid_metadata", plan->metadata.at(answered)}});
  }
  const auto issuedAt =
      std::chrono::duration_cast<std::chrono::seconds>(std::chrono::system_clock::now().time_since_epoch());
  const platform::Result<std::vector<uint8_t>> record =
      encodeActivationRecord({request.uuid, plan->ppid, issuedAt.count()});
  if (!record) {
    return internalError(record.error());
  }
  const platform::Result<std::vector<uint8_t>> signature = signActivationRecord(*record, setupKey_);
  if (!signature) {
    return internalError(signature.error());
  }
  return jsonAnswer(200, json{{"tokens", json::array({base64Encode(*record), base64Encode(*signature)})}});
}

// A token mapped by the catalogue gets its plan; one of our own replacement tokens keeps the
// plan it was issued for, while the catalogue still has it; anything else the default plan.
platform::Result<const ProductPlan*> DeviceServices::planFor(const std::vector<std::vector<uint8_t>>& tokens) const {
  const platform::Result<const ProductPlan*> mapped = catalog_.mapped(tokens.front());
  if (!mapped || *mapped != nullptr) {
    return mapped;
  }
  if (tokens.size() >= 2) {
    if (const auto record = decodeActivationToken(tokens[0], tokens[1], setupKey_)) {
      if (const ProductPlan* plan = catalog_.withPPID(record->ppid)) {
        return plan;
      }
    }
  }
  return catalog_.fallback();
}

std::optional<std::array<uint8_t, 40>> DeviceServices::sign(const Answer& answer, std::string_view body) {
  if (!answer.seq) {
    return std::nullopt;
  }
  const auto signed_ = sap_.signResponse(answer.sessionIdentifier, *answer.seq, bytesOf(body));
  if (signed_.status != TarvexSAPServerStatus::ok) {
    return std::nullopt;
  }
  return signed_.signature;
}

}  // namespace devserver
