// Token data is one or more DER items written back to back with no enclosing sequence.
// parseTokenArray cuts it into its items, each a copy of the item's complete encoding (identifier,
// length and contents), in order. It checks only that the data is a run of well-formed items, never
// their tags. nullopt for no data, zero-length data, or any item that does not decode; a single
// byte left after the last item (or a one-byte input) is ignored, two or more must form an item.
#pragma once

#include <optional>
#include <vector>

#include "platform/values/data.h"

// parseTokenArray returns the items of `tokenData` as above.
std::optional<std::vector<platform::Data>> parseTokenArray(const std::optional<platform::Data>& tokenData);
