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
#include <string_view>

#include "platform/bus/messaging.h"
#include "platform/values/value.h"

namespace platform {

// True when `text` is well-formed UTF-8 with no NUL, as a D-Bus string must be; false otherwise.
bool isBusString(std::string_view text);

// Reads the next complete value of any type. Negative errno on a malformed message.
int readBusValue(sd_bus_message* message, Value& out);

// What a key of an a{sv} argument must hold: a value of `signature`, and for byte arrays ("ay")
// and strings ("s") at most `maximumLength` bytes when that is not 0.
struct BusKey {
  std::string signature;
  size_t maximumLength = 0;
};

// An a{sv} argument whose keys are known in advance. Calls `take(key, message)` with the message at
// the start of each value's variant contents (the variant already entered; `take` reads exactly
// that value). Returns nullopt when every entry was taken; unknown keys, repeated keys, values of
// another type or too long, and a negative `take` are InvalidArgs errors naming the key.
using BusDictionaryReader = std::function<int(const std::string& key, sd_bus_message* message)>;
// readKnownDictionary reads an a{sv} argument as above.
std::optional<BusError> readKnownDictionary(sd_bus_message* message, const std::map<std::string, BusKey>& keys,
                                            const BusDictionaryReader& take);

}  // namespace platform
