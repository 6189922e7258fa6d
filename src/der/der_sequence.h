// Walking the items of a DER SEQUENCE or SET, and filling a caller's record from a sequence by a
// template of rows. Items are decoded strictly and never descended into; nothing is copied.
// Out-parameters must not be null.
#pragma once

#include <cstdint>

#include "der/der_types.h"

// Decodes one item that must be a constructed SEQUENCE or SET (else DER_STATUS_UNEXPECTED_TAG)
// and sets `cursor` on its content. `tag` receives the item's tag whenever the item decodes,
// even when it is not a sequence.
DERStatus DERDecodeSeqInit(DERSlice input, DERTag* tag, DERSeqCursor* cursor);

// Sets `cursor` on a range that is already the content of a sequence. Always DER_STATUS_OK.
DERStatus DERDecodeSeqContentInit(DERSlice content, DERSeqCursor* cursor);

// Decodes the next item and moves the cursor past it; DER_STATUS_END_OF_SEQUENCE when none is
// left. On failure the cursor and the item are left as they were.
DERStatus DERDecodeSeqNext(DERSeqCursor* cursor, DERDecodedItem* item);

// Decodes one item that must be exactly a constructed SEQUENCE (a SET is refused with
// DER_STATUS_UNEXPECTED_TAG) and parses its content by DERParseSequenceContent. Bytes after the
// sequence are ignored; `dest` is untouched when the sequence itself does not decode.
DERStatus DERParseSequence(DERSlice input, std::uint16_t fieldCount, const DERFieldSpec* fields, void* dest,
                           std::uint64_t destSize);

// Parses the items of a sequence's content against `fieldCount` template rows, writing a
// DERSlice (the item's content, or with DER_FIELD_KEEP_HEADER the whole item) at each matched
// row's offset in `dest`, which need not be aligned.
// - When `destSize` is not 0, the first `destSize` bytes of `dest` are zeroed first, so absent
//   fields read as (null, 0), and a template whose written rows do not fit in `destSize` bytes is
//   refused with DER_STATUS_DECODE_ERROR before anything is parsed. With 0, offsets are trusted.
// - Rows are matched strictly in order: an optional row whose tag does not match the current
//   item is passed over for good; a required one gives DER_STATUS_UNEXPECTED_TAG.
// - Every item must match a row (else DER_STATUS_UNEXPECTED_TAG), no bytes may follow the item
//   that matches the last row (else DER_STATUS_DECODE_ERROR), and the content may end only where
//   all remaining rows are optional (else DER_STATUS_INCOMPLETE_SEQUENCE).
DERStatus DERParseSequenceContent(DERSlice content, std::uint16_t fieldCount, const DERFieldSpec* fields, void* dest,
                                  std::uint64_t destSize);
