// Entitlement queries on a connection's peer.
//
// hasEntitlement: the value is a true number (Booleans included), or any array or dictionary.
// hasCategory: the value is an array holding the category, or a dictionary whose entry under the
// category is a number, answered by that number's truth. Anything else is no.
#pragma once

#include <string_view>

#include "platform/listener/connection.h"

namespace Entitlements {

// hasEntitlement is true when the peer of `connection` holds `entitlement` as above; false when it
// does not, or when its identity is not established.
bool hasEntitlement(const platform::Connection& connection, std::string_view entitlement);
// hasCategory is true when the peer's value for `entitlement` grants `category` as above.
bool hasCategory(const platform::Connection& connection, std::string_view category, std::string_view entitlement);

}  // namespace Entitlements
