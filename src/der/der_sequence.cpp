#include "der/der_sequence.h"

#include <cstring>

#include "der/der_item.h"

namespace {

// True when every row that writes leaves room for its DERSlice within `destSize` bytes.
bool rowsFit(std::uint16_t fieldCount, const DERFieldSpec* fields, std::uint64_t destSize) {
  for (std::uint16_t i = 0; i < fieldCount; ++i) {
    if ((fields[i].options & DER_FIELD_SKIP_WRITE) != 0) continue;
    if (fields[i].offset > destSize || destSize - fields[i].offset < sizeof(DERSlice)) {
      return false;
    }
  }
  return true;
}

bool matches(const DERFieldSpec& field, DERTag tag) {
  return (field.options & DER_FIELD_SKIP_TAG_CHECK) != 0 || field.tag == tag;
}

}  // namespace

DERStatus DERDecodeSeqInit(DERSlice input, DERTag* tag, DERSeqCursor* cursor) {
  DERDecodedItem item;
  if (const DERStatus status = DERDecodeItem(input, &item); status != DER_STATUS_OK) {
    return status;
  }
  *tag = item.tag;
  // SEQUENCE (0x10) and SET (0x11) differ only in the lowest bit; both must be constructed.
  if ((item.tag & ~DERTag{1}) != DER_TAG_SEQUENCE) return DER_STATUS_UNEXPECTED_TAG;
  return DERDecodeSeqContentInit(item.content, cursor);
}

DERStatus DERDecodeSeqContentInit(DERSlice content, DERSeqCursor* cursor) {
  cursor->next = content.data;
  cursor->end = content.data + content.length;
  return DER_STATUS_OK;
}

DERStatus DERDecodeSeqNext(DERSeqCursor* cursor, DERDecodedItem* item) {
  if (cursor->next >= cursor->end) return DER_STATUS_END_OF_SEQUENCE;
  const DERSlice rest{cursor->next, static_cast<std::uint64_t>(cursor->end - cursor->next)};
  DERDecodedItem decoded;
  if (const DERStatus status = DERDecodeItem(rest, &decoded); status != DER_STATUS_OK) {
    return status;
  }
  *item = decoded;
  cursor->next = decoded.content.data + decoded.content.length;
  return DER_STATUS_OK;
}

DERStatus DERParseSequence(DERSlice input, std::uint16_t fieldCount, const DERFieldSpec* fields, void* dest,
                           std::uint64_t destSize) {
  DERDecodedItem sequence;
  if (const DERStatus status = DERDecodeItem(input, &sequence); status != DER_STATUS_OK) {
    return status;
  }
  if (sequence.tag != DER_TAG_SEQUENCE) return DER_STATUS_UNEXPECTED_TAG;
  return DERParseSequenceContent(sequence.content, fieldCount, fields, dest, destSize);
}

DERStatus DERParseSequenceContent(DERSlice content, std::uint16_t fieldCount, const DERFieldSpec* fields, void* dest,
                                  std::uint64_t destSize) {
  if (destSize != 0) {
    std::memset(dest, 0, destSize);
    if (!rowsFit(fieldCount, fields, destSize)) return DER_STATUS_DECODE_ERROR;
  }
  if (fieldCount == 0) return content.length == 0 ? DER_STATUS_OK : DER_STATUS_DECODE_ERROR;

  DERSeqCursor cursor;
  DERDecodeSeqContentInit(content, &cursor);
  // `field` is always below fieldCount here: matching the last row, or passing it over, returns.
  std::uint16_t field = 0;
  for (;;) {
    const std::uint8_t* itemStart = cursor.next;
    DERDecodedItem item;
    const DERStatus status = DERDecodeSeqNext(&cursor, &item);
    if (status == DER_STATUS_END_OF_SEQUENCE) {
      for (; field < fieldCount; ++field) {
        if ((fields[field].options & DER_FIELD_OPTIONAL) == 0) {
          return DER_STATUS_INCOMPLETE_SEQUENCE;
        }
      }
      return DER_STATUS_OK;
    }
    if (status != DER_STATUS_OK) return status;

    while (!matches(fields[field], item.tag)) {
      if ((fields[field].options & DER_FIELD_OPTIONAL) == 0) return DER_STATUS_UNEXPECTED_TAG;
      if (++field == fieldCount) return DER_STATUS_UNEXPECTED_TAG;
    }

    const DERFieldSpec& row = fields[field];
    if ((row.options & DER_FIELD_SKIP_WRITE) == 0) {
      DERSlice slice = item.content;
      if ((row.options & DER_FIELD_KEEP_HEADER) != 0) {
        slice = DERSlice{itemStart, static_cast<std::uint64_t>(cursor.next - itemStart)};
      }
      std::memcpy(static_cast<std::uint8_t*>(dest) + row.offset, &slice, sizeof slice);
    }
    // Matching the last row ends the parse: any byte after its item is one too many.
    if (++field == fieldCount) {
      return cursor.next == cursor.end ? DER_STATUS_OK : DER_STATUS_DECODE_ERROR;
    }
  }
}
