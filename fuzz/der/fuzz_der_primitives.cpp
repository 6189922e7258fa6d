// Fuzzes the primitive parsers (BOOLEAN, INTEGER, BIT STRING) on arbitrary contents.
//
// Each accepted INTEGER must be exactly the minimal unsigned encoding of the value it produced,
// the 32-bit parser must agree with the 64-bit one, and the two BOOLEAN parsers and the BIT
// STRING split must agree with the bytes they read.
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "der/der_primitives.h"
#include "fuzz_check.h"

namespace {

std::size_t significantBytes(std::uint64_t value) {
  std::size_t n = 0;
  for (; value != 0; value >>= 8) ++n;
  return n;
}

void checkPrimitives(DERSlice content) {
  bool flag = false;
  const DERStatus boolean = DERParseBoolean(content, &flag);
  FUZZ_CHECK(boolean == DER_STATUS_OK || boolean == DER_STATUS_DECODE_ERROR);
  if (boolean == DER_STATUS_OK) {
    FUZZ_CHECK(content.length == 1 && content.data[0] == (flag ? 0xFF : 0x00));
  }
  bool withDefault = false;
  const DERStatus defaulted = DERParseBooleanWithDefault(content, true, &withDefault);
  FUZZ_CHECK(content.length == 0 ? defaulted == DER_STATUS_OK && withDefault : defaulted == boolean);
  if (content.length != 0 && defaulted == DER_STATUS_OK) FUZZ_CHECK(withDefault == flag);

  std::uint64_t wide = 0;
  const DERStatus status64 = DERParseInteger64(content, &wide);
  FUZZ_CHECK(status64 == DER_STATUS_OK || status64 == DER_STATUS_DECODE_ERROR || status64 == DER_STATUS_OVERFLOW);
  if (status64 == DER_STATUS_OK) {
    // The content must be the minimal unsigned encoding of the value.
    std::uint8_t encoding[9];
    std::size_t n = significantBytes(wide);
    if (n == 0) n = 1;
    const bool pad = ((wide >> (8 * (n - 1))) & 0x80) != 0;
    std::size_t length = 0;
    if (pad) encoding[length++] = 0;
    for (std::size_t i = n; i-- > 0;) encoding[length++] = static_cast<std::uint8_t>(wide >> (8 * i));
    FUZZ_CHECK(content.length == length && std::memcmp(content.data, encoding, length) == 0);
  }
  if (status64 == DER_STATUS_OVERFLOW) FUZZ_CHECK(content.length >= 9);

  std::uint32_t narrow = 0;
  const DERStatus status32 = DERParseInteger(content, &narrow);
  if (status64 != DER_STATUS_OK) {
    FUZZ_CHECK(status32 == status64);
  } else if (wide > 0xFFFFFFFFu) {
    FUZZ_CHECK(status32 == DER_STATUS_OVERFLOW);
  } else {
    FUZZ_CHECK(status32 == DER_STATUS_OK && narrow == wide);
  }

  DERSlice bits{};
  std::uint8_t unused = 0;
  FUZZ_CHECK(DERParseBitString(content, &bits, &unused) == DER_STATUS_OK);
  if (content.length > 1) {
    FUZZ_CHECK(unused == content.data[0] && bits.data == content.data + 1 && bits.length == content.length - 1);
  } else {
    FUZZ_CHECK(unused == 0 && bits.data == nullptr && bits.length == 0);
  }
}
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  checkPrimitives(DERSlice{data, size});
  return 0;
}
