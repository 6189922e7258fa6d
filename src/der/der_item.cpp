#include "der/der_item.h"

namespace {

// How an item whose declared length exceeds the bytes after its header is treated.
enum class LengthMode {
  kStrict,  // refused
  kClip,    // accepted, content clipped to the bytes available
  kUnclip,  // accepted, content reported with the declared length
};

constexpr std::uint8_t kHighTagNumber = 0x1F;
constexpr std::uint64_t kTopSevenBits = 0xFE00000000000000ULL;
constexpr std::uint64_t kClassAndConstructedBits = 0xE000000000000000ULL;

// The reads below walk `rest`, the input bytes not yet read; each is checked against its length.
std::uint8_t take(DERSlice& rest) {
  --rest.length;
  return *rest.data++;
}

// High-tag-number form: base-128 groups, most significant first, the top bit set on all but the
// last. A leading zero group or a number below 31 would not be the minimal encoding.
DERStatus readHighTagNumber(DERSlice& rest, std::uint64_t* number) {
  if (*rest.data == 0x80 || *rest.data < kHighTagNumber) return DER_STATUS_DECODE_ERROR;
  std::uint64_t value = 0;
  std::uint8_t group = 0;
  do {
    // Each group must leave at least the length octet behind it.
    if ((value & kTopSevenBits) != 0 || rest.length < 2) return DER_STATUS_DECODE_ERROR;
    group = take(rest);
    value = (value << 7) | (group & 0x7F);
  } while ((group & 0x80) != 0);
  if ((value & kClassAndConstructedBits) != 0) return DER_STATUS_DECODE_ERROR;
  *number = value;
  return DER_STATUS_OK;
}

// The identifier octets; `rest` holds at least two bytes.
DERStatus readTag(DERSlice& rest, DERTag* tag) {
  const std::uint8_t identifier = take(rest);
  std::uint64_t number = identifier & kHighTagNumber;
  if (number == kHighTagNumber) {
    if (const DERStatus status = readHighTagNumber(rest, &number); status != DER_STATUS_OK) return status;
  }
  *tag = (static_cast<DERTag>(identifier & 0xE0) << 56) | number;
  return DER_STATUS_OK;
}

// The length octets in their minimal definite form; `rest` holds at least one byte.
DERStatus readLength(DERSlice& rest, std::uint64_t* length) {
  const std::uint8_t lengthOctet = take(rest);
  if ((lengthOctet & 0x80) == 0) {
    *length = lengthOctet;
    return DER_STATUS_OK;
  }
  const std::uint8_t count = lengthOctet & 0x7F;
  if (count == 0 || count > 8) return DER_STATUS_DECODE_ERROR;  // indefinite, or too wide
  if (rest.length < count) return DER_STATUS_DECODE_ERROR;
  if (*rest.data == 0) return DER_STATUS_DECODE_ERROR;
  std::uint64_t value = 0;
  for (std::uint8_t i = 0; i < count; ++i) value = (value << 8) | take(rest);
  *length = value;
  return DER_STATUS_OK;
}

DERStatus decodeItem(DERSlice input, DERDecodedItem* item, LengthMode mode, std::uint64_t* declaredLength) {
  if (input.length < 2) return DER_STATUS_DECODE_ERROR;
  DERSlice rest = input;
  DERTag tag = 0;
  if (const DERStatus status = readTag(rest, &tag); status != DER_STATUS_OK) return status;
  // At least one byte is left: the input has two, and the high-tag loop keeps one back.
  std::uint64_t length = 0;
  if (const DERStatus status = readLength(rest, &length); status != DER_STATUS_OK) return status;

  std::uint64_t contentLength = length;
  if (length > rest.length) {
    switch (mode) {
      case LengthMode::kStrict:
        return DER_STATUS_DECODE_ERROR;
      case LengthMode::kClip:
        contentLength = rest.length;
        break;
      case LengthMode::kUnclip:
        break;
    }
  }
  item->tag = tag;
  item->content = DERSlice{rest.data, contentLength};
  if (declaredLength != nullptr) *declaredLength = length;
  return DER_STATUS_OK;
}

}  // namespace

DERStatus DERDecodeItem(DERSlice input, DERDecodedItem* item) {
  return decodeItem(input, item, LengthMode::kStrict, nullptr);
}

DERStatus DERDecodeItemPartialBufferGetLength(DERSlice input, DERDecodedItem* item, std::uint64_t* declaredLength) {
  const LengthMode mode = declaredLength != nullptr ? LengthMode::kClip : LengthMode::kStrict;
  return decodeItem(input, item, mode, declaredLength);
}

DERStatus DERDecodeItemPartialBuffer(DERSlice input, DERDecodedItem* item, bool allowPartial) {
  const LengthMode mode = allowPartial ? LengthMode::kUnclip : LengthMode::kStrict;
  return decodeItem(input, item, mode, nullptr);
}
