// Fuzzes the three item decoders on arbitrary bytes.
//
// Beyond memory safety it checks that the three entry points agree with one another, that a
// decoded header is exactly the bytes it claims (by encoding the tag and length again), that an
// item needs every one of its bytes, and that a blob of items back to back is cut without gaps.
#include <algorithm>
#include <cstddef>
#include <cstdint>

#include "der/der_item.h"
#include "fuzz_check.h"

namespace {

bool same(const DERDecodedItem& a, const DERDecodedItem& b) {
  return a.tag == b.tag && a.content.data == b.content.data && a.content.length == b.content.length;
}

// Minimal identifier octets for a tag: the decoder refuses every other form, so a decoded
// header must start with exactly these bytes.
std::size_t encodeIdentifier(DERTag tag, std::uint8_t* out) {
  const auto leading = static_cast<std::uint8_t>(tag >> 56) & 0xE0;
  const std::uint64_t number = tag & DER_TAG_NUMBER_MASK;
  if (number < 31) {
    out[0] = leading | static_cast<std::uint8_t>(number);
    return 1;
  }
  out[0] = leading | 0x1F;
  std::size_t groups = 1;
  while (groups < 9 && (number >> (7 * groups)) != 0) ++groups;
  for (std::size_t i = 0; i < groups; ++i) {
    const auto bits = static_cast<std::uint8_t>((number >> (7 * (groups - 1 - i))) & 0x7F);
    out[1 + i] = bits | (i + 1 < groups ? 0x80 : 0x00);
  }
  return 1 + groups;
}

std::size_t significantBytes(std::uint64_t value) {
  std::size_t n = 0;
  for (; value != 0; value >>= 8) ++n;
  return n;
}

void checkHeader(const std::uint8_t* data, std::size_t size, const DERDecodedItem& item, std::uint64_t declared) {
  const std::uint8_t* contentStart = item.content.data;
  FUZZ_CHECK(contentStart >= data + 2 && contentStart <= data + size);
  const auto headerLength = static_cast<std::size_t>(contentStart - data);

  std::uint8_t identifier[10];
  const std::size_t identifierLength = encodeIdentifier(item.tag, identifier);
  FUZZ_CHECK(identifierLength < headerLength);
  FUZZ_CHECK(std::equal(identifier, identifier + identifierLength, data));

  const std::uint8_t* lengthOctets = data + identifierLength;
  const std::size_t lengthLength = headerLength - identifierLength;
  if (lengthLength == 1) {
    FUZZ_CHECK(lengthOctets[0] < 0x80 && lengthOctets[0] == declared);
  } else {
    // Long form: a count, then that many bytes with no leading zero (a value below 128 is
    // accepted in long form, so the count is all that can be checked against the value).
    FUZZ_CHECK(lengthLength >= 2 && lengthLength <= 9);
    FUZZ_CHECK(lengthOctets[0] == (0x80 | (lengthLength - 1)));
    FUZZ_CHECK(significantBytes(declared) == lengthLength - 1);
  }
}

void checkItem(const std::uint8_t* data, std::size_t size) {
  const DERSlice input{data, size};

  DERDecodedItem strict;
  const DERStatus status = DERDecodeItem(input, &strict);
  FUZZ_CHECK(status == DER_STATUS_OK || status == DER_STATUS_DECODE_ERROR);

  DERDecodedItem other;
  FUZZ_CHECK(DERDecodeItemPartialBufferGetLength(input, &other, nullptr) == status);
  if (status == DER_STATUS_OK) FUZZ_CHECK(same(other, strict));
  FUZZ_CHECK(DERDecodeItemPartialBuffer(input, &other, false) == status);
  if (status == DER_STATUS_OK) FUZZ_CHECK(same(other, strict));

  DERDecodedItem clipped;
  std::uint64_t declared = 0;
  const DERStatus clippedStatus = DERDecodeItemPartialBufferGetLength(input, &clipped, &declared);
  DERDecodedItem unclipped;
  const DERStatus unclippedStatus = DERDecodeItemPartialBuffer(input, &unclipped, true);
  FUZZ_CHECK(clippedStatus == unclippedStatus);
  FUZZ_CHECK(clippedStatus == DER_STATUS_OK || clippedStatus == DER_STATUS_DECODE_ERROR);
  if (clippedStatus != DER_STATUS_OK) {
    FUZZ_CHECK(status != DER_STATUS_OK);
    return;
  }
  FUZZ_CHECK(clipped.tag == unclipped.tag && clipped.content.data == unclipped.content.data);
  FUZZ_CHECK(unclipped.content.length == declared);
  const auto available = static_cast<std::uint64_t>(data + size - clipped.content.data);
  FUZZ_CHECK(clipped.content.length == std::min(declared, available));
  FUZZ_CHECK((status == DER_STATUS_OK) == (declared <= available));
  checkHeader(data, size, clipped, declared);
  if (status != DER_STATUS_OK) return;

  FUZZ_CHECK(same(clipped, strict));
  // The item needs every one of its bytes and nothing after them.
  const auto itemLength = static_cast<std::uint64_t>(strict.content.data + strict.content.length - data);
  FUZZ_CHECK(DERDecodeItem(DERSlice{data, itemLength}, &other) == DER_STATUS_OK);
  FUZZ_CHECK(same(other, strict));
  FUZZ_CHECK(DERDecodeItem(DERSlice{data, itemLength - 1}, &other) == DER_STATUS_DECODE_ERROR);
}

// Cuts the input into items back to back, as token data is cut.
void checkBlob(const std::uint8_t* data, std::size_t size) {
  const std::uint8_t* p = data;
  const std::uint8_t* end = data + size;
  while (p < end) {
    DERDecodedItem item;
    if (DERDecodeItem(DERSlice{p, static_cast<std::uint64_t>(end - p)}, &item) != DER_STATUS_OK) {
      return;
    }
    const std::uint8_t* next = item.content.data + item.content.length;
    FUZZ_CHECK(next > p + 1 && next <= end);
    p = next;
  }
  FUZZ_CHECK(p == end);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  checkItem(data, size);
  checkBlob(data, size);
  return 0;
}
