// Types shared by the DER decoder (ITU-T X.690): status codes, byte ranges, tags, decoded items,
// sequence cursors and sequence template rows. The structs are plain C-layout records; every
// DERSlice borrows the caller's buffer, which must outlive it.
#pragma once

#include <cstdint>

// Result of every decoder function. 4 and 6 are reserved and never returned.
enum DERStatus : std::uint32_t {
  DER_STATUS_OK = 0,
  DER_STATUS_END_OF_SEQUENCE = 1,      // no more items (DERDecodeSeqNext only)
  DER_STATUS_UNEXPECTED_TAG = 2,       // an item's tag is not one the caller allowed
  DER_STATUS_DECODE_ERROR = 3,         // malformed, longer than the buffer, or bytes left over
  DER_STATUS_INCOMPLETE_SEQUENCE = 5,  // a sequence ended before a required template field
  DER_STATUS_OVERFLOW = 7,             // an integer does not fit the requested width
};

// A borrowed byte range.
struct DERSlice {
  const std::uint8_t* data;
  std::uint64_t length;
};

// Bits 63-62 the class, bit 61 the constructed flag, bits 60-0 the tag number; that is
// (first identifier octet & 0xE0) << 56 | number.
typedef std::uint64_t DERTag;

inline constexpr DERTag DER_TAG_CLASS_MASK = 0xC000000000000000ULL;
inline constexpr DERTag DER_TAG_CLASS_UNIVERSAL = 0x0000000000000000ULL;
inline constexpr DERTag DER_TAG_CLASS_APPLICATION = 0x4000000000000000ULL;
inline constexpr DERTag DER_TAG_CLASS_CONTEXT_SPECIFIC = 0x8000000000000000ULL;
inline constexpr DERTag DER_TAG_CLASS_PRIVATE = 0xC000000000000000ULL;
inline constexpr DERTag DER_TAG_CONSTRUCTED = 0x2000000000000000ULL;
inline constexpr DERTag DER_TAG_NUMBER_MASK = 0x1FFFFFFFFFFFFFFFULL;

inline constexpr DERTag DER_TAG_BOOLEAN = 0x01;
inline constexpr DERTag DER_TAG_INTEGER = 0x02;
inline constexpr DERTag DER_TAG_BIT_STRING = 0x03;
inline constexpr DERTag DER_TAG_OCTET_STRING = 0x04;
inline constexpr DERTag DER_TAG_NULL = 0x05;
inline constexpr DERTag DER_TAG_OBJECT_IDENTIFIER = 0x06;
inline constexpr DERTag DER_TAG_UTF8_STRING = 0x0C;
inline constexpr DERTag DER_TAG_GENERALIZED_TIME = 0x18;
inline constexpr DERTag DER_TAG_SEQUENCE = DER_TAG_CONSTRUCTED | 0x10;  // 0x2000000000000010
inline constexpr DERTag DER_TAG_SET = DER_TAG_CONSTRUCTED | 0x11;       // 0x2000000000000011

struct DERDecodedItem {
  DERTag tag;
  DERSlice content;  // the contents octets only, after identifier and length
};

struct DERSeqCursor {
  const std::uint8_t* next;  // the next item to decode
  const std::uint8_t* end;   // one past the last byte of the sequence's content
};

// Options of a template row (a bit set).
typedef std::uint16_t DERFieldOptions;
inline constexpr DERFieldOptions DER_FIELD_OPTIONAL = 1;        // the field may be absent
inline constexpr DERFieldOptions DER_FIELD_SKIP_TAG_CHECK = 2;  // matches an item of any tag
inline constexpr DERFieldOptions DER_FIELD_SKIP_WRITE = 4;      // consumed, nothing written
inline constexpr DERFieldOptions DER_FIELD_KEEP_HEADER = 8;     // slice covers the whole item

// One row of a sequence template: where in the destination record a DERSlice is written, the
// tag the item must have, and options.
struct DERFieldSpec {
  std::uint64_t offset;
  DERTag tag;
  DERFieldOptions options;
};
