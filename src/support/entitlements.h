// Entitlement queries on a connection's peer.
//
// hasEntitlement: the value is a true number (Booleans included), or any array or dictionary.
// hasCategory: the value is an array holding the category, or a dictionary whose entry under the
// category is a number, answered by that number's truth. Anything else is no.
#pragma once

#include <string_view>

#include "platform/connection.h"

namespace Entitlements {

bool hasEntitlement(const platform::Connection& connection, std::string_view entitlement);
bool hasCategory(const platform::Connection& connection, std::string_view category, std::string_view entitlement);

}  // namespace Entitlements
