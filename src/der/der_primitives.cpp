#include "der/der_primitives.h"

DERStatus DERParseBoolean(DERSlice content, bool* value) {
  if (content.length != 1) return DER_STATUS_DECODE_ERROR;
  const std::uint8_t byte = content.data[0];
  if (byte != 0x00 && byte != 0xFF) return DER_STATUS_DECODE_ERROR;
  *value = byte == 0xFF;
  return DER_STATUS_OK;
}

DERStatus DERParseBooleanWithDefault(DERSlice content, bool defaultValue, bool* value) {
  if (content.length == 0) {
    *value = defaultValue;
    return DER_STATUS_OK;
  }
  return DERParseBoolean(content, value);
}

DERStatus DERParseInteger64(DERSlice content, std::uint64_t* value) {
  if (content.length == 0) return DER_STATUS_DECODE_ERROR;
  const std::uint8_t* bytes = content.data;
  if ((bytes[0] & 0x80) != 0) return DER_STATUS_DECODE_ERROR;  // negative
  if (bytes[0] != 0) {
    if (content.length >= 9) return DER_STATUS_OVERFLOW;
  } else if (content.length > 1) {
    // A leading zero is there only to keep a set top bit from reading as a sign.
    if ((bytes[1] & 0x80) == 0) return DER_STATUS_DECODE_ERROR;
    if (content.length > 9) return DER_STATUS_OVERFLOW;
  }
  // At most 9 bytes are left, and the first of 9 is zero, so the value fits.
  std::uint64_t result = 0;
  for (std::uint64_t i = 0; i < content.length; ++i) result = (result << 8) | bytes[i];
  *value = result;
  return DER_STATUS_OK;
}

DERStatus DERParseInteger(DERSlice content, std::uint32_t* value) {
  std::uint64_t wide = 0;
  if (const DERStatus status = DERParseInteger64(content, &wide); status != DER_STATUS_OK) {
    return status;
  }
  if (wide > 0xFFFFFFFFULL) return DER_STATUS_OVERFLOW;
  *value = static_cast<std::uint32_t>(wide);
  return DER_STATUS_OK;
}

DERStatus DERParseBitString(DERSlice content, DERSlice* bits, std::uint8_t* unusedBits) {
  if (content.length > 1) {
    *unusedBits = content.data[0];
    *bits = DERSlice{content.data + 1, content.length - 1};
  } else {
    // A lone count byte is dropped.
    *unusedBits = 0;
    *bits = DERSlice{nullptr, 0};
  }
  return DER_STATUS_OK;
}
