// Helpers shared by the DER decoder tests.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <vector>

#include "der/der_types.h"

namespace dertest {

using Bytes = std::vector<std::uint8_t>;

inline DERSlice slice(const Bytes& bytes) { return DERSlice{bytes.data(), bytes.size()}; }

// Concatenates byte strings, so that headers and contents read apart in the tests.
inline Bytes cat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const Bytes& part : parts) out.insert(out.end(), part.begin(), part.end());
  return out;
}

inline Bytes repeat(std::uint8_t byte, std::size_t count) { return Bytes(count, byte); }

}  // namespace dertest
