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

bool isOptional(const DERFieldSpec& field) { return (field.options & DER_FIELD_OPTIONAL) != 0; }

// What the end of the content means with rows `from` onwards unmatched: only optional rows may be.
DERStatus endOfContent(std::uint16_t from, std::uint16_t fieldCount, const DERFieldSpec* fields) {
  for (std::uint16_t i = from; i < fieldCount; ++i) {
    if (!isOptional(fields[i])) return DER_STATUS_INCOMPLETE_SEQUENCE;
  }
  return DER_STATUS_OK;
}

// Advances `*field` past optional rows to the one that matches `tag`; an unmatched required row,
// or no row left, refuses the item.
DERStatus findRow(DERTag tag, std::uint16_t fieldCount, const DERFieldSpec* fields, std::uint16_t* field) {
  while (!matches(fields[*field], tag)) {
    if (!isOptional(fields[*field])) return DER_STATUS_UNEXPECTED_TAG;
    if (++*field == fieldCount) return DER_STATUS_UNEXPECTED_TAG;
  }
  return DER_STATUS_OK;
}

// Stores the row's slice, borrowed from the input: the item's content, or the whole item from
// `itemStart` to `itemEnd`.
void writeRow(const DERFieldSpec& row, const DERDecodedItem& item, const std::uint8_t* itemStart,
              const std::uint8_t* itemEnd, void* dest) {
  if ((row.options & DER_FIELD_SKIP_WRITE) != 0) return;
  DERSlice slice = item.content;
  if ((row.options & DER_FIELD_KEEP_HEADER) != 0) {
    slice = DERSlice{itemStart, static_cast<std::uint64_t>(itemEnd - itemStart)};
  }
  std::memcpy(static_cast<std::uint8_t*>(dest) + row.offset, &slice, sizeof slice);
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
    if (status == DER_STATUS_END_OF_SEQUENCE) return endOfContent(field, fieldCount, fields);
    if (status != DER_STATUS_OK) return status;
    if (const DERStatus found = findRow(item.tag, fieldCount, fields, &field); found != DER_STATUS_OK) return found;
    writeRow(fields[field], item, itemStart, cursor.next, dest);
    // Matching the last row ends the parse: any byte after its item is one too many.
    if (++field == fieldCount) {
      return cursor.next == cursor.end ? DER_STATUS_OK : DER_STATUS_DECODE_ERROR;
    }
  }
}
