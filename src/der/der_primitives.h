// Conversion of primitive DER contents (the bytes after identifier and length): BOOLEAN,
// unsigned INTEGER and BIT STRING. Out-parameters are written only on success and must not be
// null.
#pragma once

#include <cstdint>

#include "der/der_types.h"

// BOOLEAN: exactly one byte, 0x00 (false) or 0xFF (true).
DERStatus DERParseBoolean(DERSlice content, bool* value);

// As DERParseBoolean, except that an empty content gives `defaultValue`.
DERStatus DERParseBooleanWithDefault(DERSlice content, bool defaultValue, bool* value);

// Unsigned INTEGER: an empty content, a negative number or a non-minimal leading zero is
// DER_STATUS_DECODE_ERROR; a value wider than the result is DER_STATUS_OVERFLOW.
DERStatus DERParseInteger(DERSlice content, std::uint32_t* value);
DERStatus DERParseInteger64(DERSlice content, std::uint64_t* value);

// BIT STRING: the first byte is the unused-bit count and the rest the bits. A content of fewer
// than 2 bytes gives a count of 0 and the bits (null, 0). Neither the count nor the unused bits
// are checked, on purpose. Always DER_STATUS_OK.
DERStatus DERParseBitString(DERSlice content, DERSlice* bits, std::uint8_t* unusedBits);
