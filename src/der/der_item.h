// Decoding of one DER item: identifier octets (low- and high-tag-number forms), definite length
// octets and the contents' range. Nothing is copied: the content slice points into the input.
//
// Deliberately lenient: a long-form length for a value below 128 (0x81 0x05) is accepted; only
// a leading zero length byte (0x81 0x00), the indefinite form (0x80) and more than 8 length
// bytes are refused. Bytes after the item are ignored. Out-parameters are written only on
// success and must not be null unless marked optional.
#pragma once

#include <cstdint>

#include "der/der_types.h"

// Decodes the item at the start of `input`. Strict: its content must lie within the input.
DERStatus DERDecodeItem(DERSlice input, DERDecodedItem* item);

// As DERDecodeItem when `declaredLength` is null. When it is given, an item whose content runs
// past the input is accepted: the content is clipped to the bytes available and
// *declaredLength receives the length the item declares.
DERStatus DERDecodeItemPartialBufferGetLength(DERSlice input, DERDecodedItem* item, std::uint64_t* declaredLength);

// As DERDecodeItem when `allowPartial` is false. When it is true, an item whose content runs
// past the input is accepted and its content reported with the declared, unclipped length: the
// caller must not read past its own buffer.
DERStatus DERDecodeItemPartialBuffer(DERSlice input, DERDecodedItem* item, bool allowPartial);
