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

DERStatus decodeItem(DERSlice input, DERDecodedItem* item, LengthMode mode, std::uint64_t* declaredLength) {
  if (input.length < 2) return DER_STATUS_DECODE_ERROR;
  // `remaining` always counts the input bytes from `p` on, so every read is checked against it.
  const std::uint8_t* p = input.data;
  std::uint64_t remaining = input.length;

  const std::uint8_t identifier = *p++;
  --remaining;
  std::uint64_t number = identifier & kHighTagNumber;
  if (number == kHighTagNumber) {
    // High-tag-number form: base-128 groups, most significant first, the top bit set on all but
    // the last. A leading zero group or a number below 31 would not be the minimal encoding.
    if (*p == 0x80 || *p < kHighTagNumber) return DER_STATUS_DECODE_ERROR;
    number = 0;
    std::uint8_t group = 0;
    do {
      // Each group must leave at least the length octet behind it.
      if ((number & kTopSevenBits) != 0 || remaining < 2) return DER_STATUS_DECODE_ERROR;
      group = *p++;
      --remaining;
      number = (number << 7) | (group & 0x7F);
    } while ((group & 0x80) != 0);
    if ((number & kClassAndConstructedBits) != 0) return DER_STATUS_DECODE_ERROR;
  }
  const DERTag tag = (static_cast<DERTag>(identifier & 0xE0) << 56) | number;

  // At least one byte is left: the input has two, and the high-tag loop keeps one back.
  const std::uint8_t lengthOctet = *p++;
  --remaining;
  std::uint64_t length = lengthOctet;
  if ((lengthOctet & 0x80) != 0) {
    const std::uint8_t count = lengthOctet & 0x7F;
    if (count == 0 || count > 8) return DER_STATUS_DECODE_ERROR;  // indefinite, or too wide
    if (remaining < count) return DER_STATUS_DECODE_ERROR;
    if (*p == 0) return DER_STATUS_DECODE_ERROR;
    length = 0;
    for (std::uint8_t i = 0; i < count; ++i) length = (length << 8) | *p++;
    remaining -= count;
  }

  std::uint64_t contentLength = length;
  if (length > remaining) {
    switch (mode) {
      case LengthMode::kStrict:
        return DER_STATUS_DECODE_ERROR;
      case LengthMode::kClip:
        contentLength = remaining;
        break;
      case LengthMode::kUnclip:
        break;
    }
  }
  item->tag = tag;
  item->content = DERSlice{p, contentLength};
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
