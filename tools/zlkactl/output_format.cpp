#include "zlkactl/output_format.h"

#include "platform/values/base64.h"
#include "platform/values/json.h"
#include "zlkactl/token_input.h"

namespace zlkactl {

std::string jsonText(const platform::Value& value, bool pretty) {
  if (value.array() || value.dictionary()) return platform::json::serialize(value, pretty).value_or("null");
  // The writer takes containers only: write the value as the sole member of an array and unwrap it.
  std::string wrapped = platform::json::serialize(platform::Value(platform::Array{value})).value_or("[null]");
  return wrapped.substr(1, wrapped.size() - 2);
}

std::string formatMetadata(const zlka::Metadata& reply, bool json) {
  // The library hands over JSON it has already parsed once, so this parse succeeds.
  platform::Value metadata =
      platform::json::parse(reply.metadataJSON).value_or(platform::Value(platform::Dictionary{}));
  if (json) {
    platform::Dictionary out{{"ppid", reply.ppid}, {"locale", reply.locale}, {"metadata", std::move(metadata)}};
    return jsonText(platform::Value(std::move(out)), false) + "\n";
  }
  return "ppid: " + reply.ppid + "\nlocale: " + reply.locale + "\nmetadata:\n" + jsonText(metadata, true) + "\n";
}

std::string formatActivation(const zlka::Bytes& bytes, bool json) {
  platform::Data token(bytes.data(), bytes.size());
  if (json) {
    platform::Dictionary out{{"token_hex", hexString(token)},
                             {"token_base64", platform::base64Encode(token.span())},
                             {"length", static_cast<uint64_t>(token.length())}};
    return jsonText(platform::Value(std::move(out)), false) + "\n";
  }
  return "token: " + hexString(token) + "\nlength: " + std::to_string(token.length()) + " bytes\n";
}

std::string formatConfirmation(bool json) { return json ? "{\"confirmed\":true}\n" : "confirmed\n"; }

std::string formatError(const zlka::Error& error, bool json) {
  if (json) {
    platform::Dictionary out{{"domain", error.domain}, {"code", error.code}, {"description", error.description}};
    return jsonText(platform::Value(std::move(out)), false) + "\n";
  }
  if (error.domain == kToolErrorDomain) return "zlkactl: " + error.description + "\n";
  return "zlkactl: " + error.domain + " " + std::to_string(error.code) + ": " + error.description + "\n";
}

zlka::Error toolError(int exitStatus, std::string description) {
  return {kToolErrorDomain, exitStatus, std::move(description), {}};
}

}  // namespace zlkactl
