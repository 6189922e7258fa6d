// Null handling and equality of optional values, and a protocol-conformance test.
#pragma once

#include <optional>
#include <set>
#include <string>

#include "platform/protocol.h"
#include "platform/value.h"

// True for no value and for the null value of parsed JSON.
bool isNSObjectNull(const std::optional<platform::Value>& object);
// No value when isNSObjectNull, else the object.
std::optional<platform::Value> NSObjectIfNotNull(const std::optional<platform::Value>& object);
// True when both are absent; otherwise the first one's equality with the second.
bool isNSObjectEqual(const std::optional<platform::Value>& a, const std::optional<platform::Value>& b);

// Lists the protocol's methods picked by the two flags and checks that the class's instances answer
// each one (the instance test is used for class methods too). True when nothing is missing; the
// missing names go to *missing when given (empty when none).
bool classImplementsMethodsInProtocol(const platform::ClassDescription& cls, const platform::Protocol& protocol,
                                      bool required, bool instanceMethods, std::set<std::string>* missing = nullptr);
