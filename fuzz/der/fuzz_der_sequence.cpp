// Fuzzes sequence walking and template parsing.
//
// Input: one byte for the field count (low 3 bits), two bytes per field (options, then a tag
// written like an identifier octet: class and constructed bits, and a number below 32), and the
// rest is DER. The rest is parsed with that template and with a fixed one that uses every
// option, both as a sequence's content and as an encoded SEQUENCE. Each result is compared with
// a plain model of the matching rules, worked out on the items that the sequence walk yields; the
// walk itself is checked for progress and bounds.
#include <cstddef>
#include <cstdint>
#include <vector>

#include "der/der_item.h"
#include "der/der_sequence.h"
#include "fuzz_check.h"

namespace {

constexpr std::size_t kMaxFields = 7;

struct WalkedItem {
  const std::uint8_t* start;
  DERDecodedItem item;
};

struct Walk {
  std::vector<WalkedItem> items;
  DERStatus end;  // END_OF_SEQUENCE, or the error that stopped the walk
};

Walk walk(DERSeqCursor cursor) {
  Walk result;
  const std::uint8_t* const end = cursor.end;
  for (;;) {
    const DERSeqCursor before = cursor;
    DERDecodedItem item;
    const DERStatus status = DERDecodeSeqNext(&cursor, &item);
    if (status != DER_STATUS_OK) {
      FUZZ_CHECK(status == DER_STATUS_END_OF_SEQUENCE || status == DER_STATUS_DECODE_ERROR);
      FUZZ_CHECK(cursor.next == before.next && cursor.end == before.end);
      FUZZ_CHECK((status == DER_STATUS_END_OF_SEQUENCE) == (cursor.next == end));
      result.end = status;
      return result;
    }
    FUZZ_CHECK(cursor.end == end);
    FUZZ_CHECK(item.content.data > before.next && cursor.next > before.next + 1);
    FUZZ_CHECK(cursor.next == item.content.data + item.content.length && cursor.next <= end);
    result.items.push_back({before.next, item});
  }
}

// What the template parser must produce, worked out from the walked items.
DERStatus expectedStatus(const Walk& w, std::size_t fieldCount, const DERFieldSpec* fields,
                         std::vector<int>& matchedItem) {
  matchedItem.assign(fieldCount, -1);
  std::size_t field = 0;
  for (std::size_t i = 0; i < w.items.size(); ++i) {
    const DERTag tag = w.items[i].item.tag;
    while (field < fieldCount && (fields[field].options & DER_FIELD_SKIP_TAG_CHECK) == 0 && fields[field].tag != tag) {
      if ((fields[field].options & DER_FIELD_OPTIONAL) == 0) return DER_STATUS_UNEXPECTED_TAG;
      ++field;
    }
    if (field == fieldCount) return DER_STATUS_UNEXPECTED_TAG;
    matchedItem[field] = static_cast<int>(i);
    if (++field == fieldCount) {
      const bool nothingFollows = i + 1 == w.items.size() && w.end == DER_STATUS_END_OF_SEQUENCE;
      return nothingFollows ? DER_STATUS_OK : DER_STATUS_DECODE_ERROR;
    }
  }
  if (w.end != DER_STATUS_END_OF_SEQUENCE) return w.end;
  for (; field < fieldCount; ++field) {
    if ((fields[field].options & DER_FIELD_OPTIONAL) == 0) return DER_STATUS_INCOMPLETE_SEQUENCE;
  }
  return DER_STATUS_OK;
}

bool equal(const DERSlice& a, const DERSlice& b) { return a.data == b.data && a.length == b.length; }

void checkTemplate(DERSlice content, std::size_t fieldCount, const DERFieldSpec* fields, const DERSlice* record,
                   DERStatus status) {
  if (fieldCount == 0) {
    FUZZ_CHECK(status == (content.length == 0 ? DER_STATUS_OK : DER_STATUS_DECODE_ERROR));
    return;
  }
  DERSeqCursor cursor;
  FUZZ_CHECK(DERDecodeSeqContentInit(content, &cursor) == DER_STATUS_OK);
  const Walk w = walk(cursor);
  std::vector<int> matchedItem;
  FUZZ_CHECK(status == expectedStatus(w, fieldCount, fields, matchedItem));
  if (status != DER_STATUS_OK) return;
  for (std::size_t f = 0; f < fieldCount; ++f) {
    DERSlice expected{};
    if (matchedItem[f] >= 0 && (fields[f].options & DER_FIELD_SKIP_WRITE) == 0) {
      const WalkedItem& m = w.items[static_cast<std::size_t>(matchedItem[f])];
      expected = m.item.content;
      if ((fields[f].options & DER_FIELD_KEEP_HEADER) != 0) {
        const std::uint8_t* end = m.item.content.data + m.item.content.length;
        expected = DERSlice{m.start, static_cast<std::uint64_t>(end - m.start)};
      }
    }
    FUZZ_CHECK(equal(record[f], expected));
  }
}

// A fixed template that uses every option: [0] kept whole, an optional BOOLEAN, anything
// (not written), an optional INTEGER that is not written, an optional OCTET STRING kept whole.
const DERFieldSpec kFixedFields[] = {
    {0 * sizeof(DERSlice), DER_TAG_CLASS_CONTEXT_SPECIFIC | DER_TAG_CONSTRUCTED | 0, DER_FIELD_KEEP_HEADER},
    {1 * sizeof(DERSlice), DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL},
    {2 * sizeof(DERSlice), 0, DER_FIELD_SKIP_TAG_CHECK | DER_FIELD_SKIP_WRITE},
    {3 * sizeof(DERSlice), DER_TAG_INTEGER, DER_FIELD_OPTIONAL | DER_FIELD_SKIP_WRITE},
    {4 * sizeof(DERSlice), DER_TAG_OCTET_STRING, DER_FIELD_OPTIONAL | DER_FIELD_KEEP_HEADER},
};
constexpr std::size_t kFixedCount = sizeof kFixedFields / sizeof kFixedFields[0];

// Parses `der` with a template both as content and as an encoded SEQUENCE, and checks both.
void checkWithTemplate(DERSlice der, std::size_t fieldCount, const DERFieldSpec* fields) {
  DERSlice record[kMaxFields];
  const auto count = static_cast<std::uint16_t>(fieldCount);
  const DERStatus contentStatus = DERParseSequenceContent(der, count, fields, record, sizeof record);
  checkTemplate(der, fieldCount, fields, record, contentStatus);

  DERDecodedItem outer;
  const DERStatus outerStatus = DERDecodeItem(der, &outer);
  const DERStatus sequenceStatus = DERParseSequence(der, count, fields, record, sizeof record);
  if (outerStatus != DER_STATUS_OK) {
    FUZZ_CHECK(sequenceStatus == outerStatus);
  } else if (outer.tag != DER_TAG_SEQUENCE) {
    FUZZ_CHECK(sequenceStatus == DER_STATUS_UNEXPECTED_TAG);
  } else {
    checkTemplate(outer.content, fieldCount, fields, record, sequenceStatus);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size < 1) return 0;
  const std::size_t fieldCount = data[0] & kMaxFields;
  const std::size_t header = 1 + 2 * fieldCount;
  if (size < header) return 0;

  DERFieldSpec fields[kMaxFields];
  for (std::size_t f = 0; f < fieldCount; ++f) {
    const std::uint8_t options = data[1 + 2 * f];
    const std::uint8_t tag = data[2 + 2 * f];
    fields[f].offset = f * sizeof(DERSlice);
    fields[f].options = options & 0x0F;
    fields[f].tag = (static_cast<DERTag>(tag & 0xE0) << 56) | (tag & 0x1F);
  }
  const DERSlice der{data + header, size - header};
  checkWithTemplate(der, fieldCount, fields);
  checkWithTemplate(der, kFixedCount, kFixedFields);

  // Walking: SeqInit agrees with the item decoder, and the walk of its content is checked.
  DERTag tag = 0;
  DERSeqCursor cursor;
  const DERStatus init = DERDecodeSeqInit(der, &tag, &cursor);
  DERDecodedItem outer;
  const DERStatus outerStatus = DERDecodeItem(der, &outer);
  if (outerStatus != DER_STATUS_OK) {
    FUZZ_CHECK(init == outerStatus);
    return 0;
  }
  FUZZ_CHECK(tag == outer.tag);
  const bool isSequence = tag == DER_TAG_SEQUENCE || tag == DER_TAG_SET;
  FUZZ_CHECK(init == (isSequence ? DER_STATUS_OK : DER_STATUS_UNEXPECTED_TAG));
  if (init == DER_STATUS_OK) {
    FUZZ_CHECK(cursor.next == outer.content.data);
    FUZZ_CHECK(cursor.end == outer.content.data + outer.content.length);
    walk(cursor);
  }
  return 0;
}
