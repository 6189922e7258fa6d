// Reading D-Bus arguments into Values, on the bus thread.
//
// Mapping of a variant's contents: strings (s, o, g) to strings, b to Booleans, integer types and
// d to numbers, string-keyed dictionaries to dictionaries, other arrays and structs to arrays,
// nested variants unwrapped. Byte arrays become bytes, file descriptors and dictionaries with
// non-string keys become opaque values: JSON cannot hold them, which the caller's check reports.
#pragma once

#include <systemd/sd-bus.h>

#include <functional>
#include <map>
#include <optional>
#include <string>

#include "platform/messaging.h"
#include "platform/value.h"

namespace platform {

// Reads the next complete value of any type. Negative errno on a malformed message.
int readBusValue(sd_bus_message* message, Value& out);

// An a{sv} argument whose keys are known in advance with the signature each value must have.
// Calls `take(key, message)` with the message at the start of each value's variant contents (the
// variant already entered; `take` reads exactly that value). Unknown keys, repeated keys and values
// of another type are InvalidArgs errors naming the key.
using BusDictionaryReader = std::function<int(const std::string& key, sd_bus_message* message)>;
std::optional<BusError> readKnownDictionary(sd_bus_message* message, const std::map<std::string, std::string>& signatures,
                                            const BusDictionaryReader& take);

}  // namespace platform
