// The arguments of the three operations and how they are written into the single a{sv} argument.
//
// Every argument is optional: an absent one is a key not sent, which the daemon reads as a missing
// argument. Keys: "token" ay, "uuid" s, "requestedLocale" s, "requestInfo" a{sv}. Request-info values
// travel in variants as: strings s, Booleans b, signed integers x, unsigned integers x (t above
// INT64_MAX), reals d, bytes ay, arrays av, dictionaries a{sv}. A null, an opaque value, a string
// that is not UTF-8 or holds a NUL, and nesting deeper than kMaxRequestInfoDepth cannot be sent:
// unsendableReason() names the first such value before anything reaches the bus, where a malformed
// message could cost the whole connection.
#pragma once

#include <systemd/sd-bus.h>

#include <optional>
#include <string>
#include <string_view>

#include "platform/bus/bus_values.h"
#include "platform/values/data.h"
#include "platform/values/value.h"

namespace zlka_client {

// Arguments of RequestActivationForToken and ConfirmActivationForToken.
// Members default to absent, so designated initializers may name only what is given.
struct TokenArguments {
  std::optional<platform::Data> token = std::nullopt;
  std::optional<std::string> uuid = std::nullopt;
};

// Arguments of RequestMetadataForToken.
struct MetadataArguments {
  std::optional<platform::Data> token = std::nullopt;
  std::optional<std::string> uuid = std::nullopt;
  std::optional<std::string> requestedLocale = std::nullopt;  // a locale identifier such as "en_US"
  std::optional<platform::Dictionary> requestInfo = std::nullopt;
};

// Containers (dictionaries and arrays) nested inside the request info, which counts as the first.
inline constexpr int kMaxRequestInfoDepth = 16;

// unsendableReason says why `value` cannot be sent, naming it by `path` ("requestInfo.items[2]"):
// a null, an opaque value, a string or key that is not a D-Bus string, or containers nested deeper
// than kMaxRequestInfoDepth; nullopt when it can.
std::optional<std::string> unsendableReason(const platform::Value& value, const std::string& path);
// unsendableReason says why the arguments cannot be sent (a uuid that is not a D-Bus string);
// nullopt when they can.
std::optional<std::string> unsendableReason(const TokenArguments& arguments);
// unsendableReason says the same of the metadata arguments, requestedLocale and request info
// included.
std::optional<std::string> unsendableReason(const MetadataArguments& arguments);

using platform::isBusString;

// appendArguments writes the a{sv} argument of a call, only the keys given. It returns 0, or a
// negative errno when sd-bus refuses a value (check unsendableReason first).
int appendArguments(sd_bus_message* message, const TokenArguments& arguments);
int appendArguments(sd_bus_message* message, const MetadataArguments& arguments);

// appendVariant writes one value as a variant ("v" and its contents); 0 or a negative errno.
int appendVariant(sd_bus_message* message, const platform::Value& value);
// appendDictionary writes a dictionary as a{sv}; 0 or a negative errno.
int appendDictionary(sd_bus_message* message, const platform::Dictionary& dictionary);

}  // namespace zlka_client
