#include "zlkactl/output_format.h"

#include "platform/base64.h"
#include "platform/json.h"
#include "zlkactl/token_input.h"

namespace zlkactl {

std::string jsonText(const platform::Value& value, bool pretty) {
  if (value.array() || value.dictionary()) return platform::json::serialize(value, pretty).value_or("null");
  // The writer takes containers only: write the value as the sole member of an array and unwrap it.
  std::string wrapped = platform::json::serialize(platform::Value(platform::Array{value})).value_or("[null]");
  return wrapped.substr(1, wrapped.size() - 2);
}

std::string formatMetadata(const zlka_client::MetadataReply& reply, bool json) {
  if (json) {
    platform::Dictionary out{{"ppid", reply.ppid}, {"locale", reply.locale}, {"metadata", reply.metadata}};
    return jsonText(platform::Value(std::move(out)), false) + "\n";
  }
  return "ppid: " + reply.ppid + "\nlocale: " + reply.locale + "\nmetadata:\n" + jsonText(reply.metadata, true) + "\n";
}

std::string formatActivation(const platform::Data& token, bool json) {
  if (json) {
    platform::Dictionary out{{"token_hex", hexString(token)}, {"token_base64", platform::base64Encode(token.span())},
                             {"length", static_cast<uint64_t>(token.length())}};
    return jsonText(platform::Value(std::move(out)), false) + "\n";
  }
  return "token: " + hexString(token) + "\nlength: " + std::to_string(token.length()) + " bytes\n";
}

std::string formatConfirmation(bool json) { return json ? "{\"confirmed\":true}\n" : "confirmed\n"; }

std::string formatError(const platform::Error& error) {
  return "zlkactl: " + error.domain() + " " + std::to_string(error.code()) + ": " + error.localizedDescription() + "\n";
}

}  // namespace zlkactl
