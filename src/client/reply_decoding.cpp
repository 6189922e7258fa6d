#include "client/reply_decoding.h"

#include <cstring>

#include "client/client_error.h"
#include "platform/bus/bus_values.h"
#include "platform/values/json.h"

namespace zlka_client {

namespace {

platform::Error malformed(std::string what) {
  return clientError(ClientErrorCode::MalformedReply, "The service's answer is malformed: " + std::move(what) + ".");
}

std::optional<platform::Error> checkSignature(sd_bus_message* reply, const char* expected) {
  const char* signature = sd_bus_message_get_signature(reply, 1);
  std::string actual = signature ? signature : "";
  if (actual == expected) return std::nullopt;
  return malformed("its signature is \"" + actual + "\" instead of \"" + expected + "\"");
}

}  // namespace

Result<MetadataReply> decodeMetadataReply(sd_bus_message* reply) {
  if (auto error = checkSignature(reply, "sss")) return *error;
  const char* ppid = nullptr;
  const char* locale = nullptr;
  const char* json = nullptr;
  if (sd_bus_message_read(reply, "sss", &ppid, &locale, &json) < 0) return malformed("its arguments cannot be read");
  platform::Result<platform::Value> metadata = platform::json::parse(json ? json : "");
  if (!metadata) return malformed("the metadata is not JSON (" + metadata.error() + ")");
  return MetadataReply{ppid ? ppid : "", locale ? locale : "", std::move(*metadata)};
}

Result<platform::Data> decodeActivationReply(sd_bus_message* reply) {
  if (auto error = checkSignature(reply, "ay")) return *error;
  const void* bytes = nullptr;
  size_t length = 0;
  if (sd_bus_message_read_array(reply, 'y', &bytes, &length) < 0) return malformed("the token cannot be read");
  return platform::Data(bytes, length);
}

Result<Confirmation> decodeConfirmationReply(sd_bus_message* reply) {
  if (auto error = checkSignature(reply, "")) return *error;
  return Confirmation{};
}

Result<platform::Array> decodeAnyReply(sd_bus_message* reply) {
  platform::Array values;
  int r;
  while ((r = sd_bus_message_at_end(reply, 1)) == 0) {
    platform::Value value;
    if (platform::readBusValue(reply, value) < 0) return malformed("its arguments cannot be read");
    values.push_back(std::move(value));
  }
  if (r < 0) return malformed("its arguments cannot be read");
  return values;
}

}  // namespace zlka_client
