// Benchmarks of the DER decoder.
//
// Three buffers of items written back to back (many small items, a few large ones, and a token
// blob of three SEQUENCEs) are each cut into their items three ways: with DERDecodeItem, with
// parseTokenArray (which also copies each item out), and with OpenSSL's ASN1_get_object as the
// reference. Each reports items_per_second and bytes_per_second. Smaller benchmarks follow for a
// sequence walk, a template parse and an integer conversion.
#include <benchmark/benchmark.h>
#include <openssl/asn1.h>

#include <cstddef>
#include <cstdint>
#include <vector>

#include "der/der_item.h"
#include "der/der_primitives.h"
#include "der/der_sequence.h"

#if defined(ZLKA_BENCH_TOKEN_ARRAY)
#include <optional>

#include "network/token_array.h"
#include "platform/values/data.h"
#endif

namespace {

using Bytes = std::vector<std::uint8_t>;

void append(Bytes& out, const Bytes& more) { out.insert(out.end(), more.begin(), more.end()); }

Bytes tlv(std::uint8_t identifier, const Bytes& content) {
  Bytes out{identifier};
  const std::size_t length = content.size();
  if (length < 128) {
    out.push_back(static_cast<std::uint8_t>(length));
  } else {
    Bytes octets;
    for (std::size_t n = length; n != 0; n >>= 8) {
      octets.insert(octets.begin(), static_cast<std::uint8_t>(n));
    }
    out.push_back(static_cast<std::uint8_t>(0x80 | octets.size()));
    append(out, octets);
  }
  append(out, content);
  return out;
}

// 10,000 short items: INTEGERs and OCTET STRINGs in turn.
Bytes manySmallItems() {
  Bytes out;
  for (int i = 0; i < 10000; ++i) {
    const auto low = static_cast<std::uint8_t>(i & 0x7F);
    append(out, i % 2 == 0 ? tlv(0x02, {0x01, low}) : tlv(0x04, {low, low, low, low, low, low}));
  }
  return out;
}

// Four OCTET STRINGs of 64 KiB, with three-byte long-form lengths.
Bytes fewLargeItems() {
  Bytes out;
  for (int i = 0; i < 4; ++i) append(out, tlv(0x04, Bytes(64 * 1024, static_cast<std::uint8_t>(i))));
  return out;
}

// A token blob: three SEQUENCEs of a few hundred bytes each, records with a signature.
Bytes tokenBlob() {
  Bytes out;
  for (int i = 0; i < 3; ++i) {
    Bytes record;
    append(record, tlv(0x0C, Bytes(36, static_cast<std::uint8_t>('A' + i))));
    append(record, tlv(0x0C, Bytes(24, 'p')));
    append(record, tlv(0x18, Bytes(15, '0')));
    append(record, tlv(0x02, {0x00, 0x9A, 0x3C, 0x11, 0x07, 0x42, 0x10, 0x55, 0x01}));
    append(record, tlv(0x04, Bytes(180 + 40 * i, 0x5A)));
    append(record, tlv(0x03, Bytes(65, 0x00)));
    append(out, tlv(0x30, record));
  }
  return out;
}

enum class Buffer { kManySmall, kFewLarge, kTokenBlob };

const Bytes& buffer(Buffer which) {
  static const Bytes small = manySmallItems();
  static const Bytes large = fewLargeItems();
  static const Bytes token = tokenBlob();
  switch (which) {
    case Buffer::kManySmall:
      return small;
    case Buffer::kFewLarge:
      return large;
    case Buffer::kTokenBlob:
      return token;
  }
  return token;
}

void reportRates(benchmark::State& state, std::size_t items, std::size_t bytes) {
  const auto iterations = static_cast<double>(state.iterations());
  state.counters["items_per_second"] =
      benchmark::Counter(iterations * static_cast<double>(items), benchmark::Counter::kIsRate);
  state.counters["bytes_per_second"] =
      benchmark::Counter(iterations * static_cast<double>(bytes), benchmark::Counter::kIsRate);
}

// Returns the number of items, or 0 when an item does not decode.
std::size_t cutWithDecodeItem(const Bytes& in) {
  const std::uint8_t* p = in.data();
  const std::uint8_t* end = in.data() + in.size();
  std::size_t count = 0;
  while (p < end) {
    DERDecodedItem item;
    if (DERDecodeItem(DERSlice{p, static_cast<std::uint64_t>(end - p)}, &item) != DER_STATUS_OK) {
      return 0;
    }
    p = item.content.data + item.content.length;
    ++count;
  }
  return count;
}

std::size_t cutWithOpenSSL(const Bytes& in) {
  const unsigned char* p = in.data();
  const unsigned char* end = in.data() + in.size();
  std::size_t count = 0;
  while (p < end) {
    long length = 0;
    int tag = 0;
    int tagClass = 0;
    if (ASN1_get_object(&p, &length, &tag, &tagClass, end - p) & 0x80) return 0;
    p += length;  // p was left on the content
    ++count;
  }
  return count;
}

void BM_CutWithDecodeItem(benchmark::State& state, Buffer which) {
  const Bytes& in = buffer(which);
  const std::size_t items = cutWithDecodeItem(in);
  if (items == 0) {
    state.SkipWithError("buffer does not decode");
    return;
  }
  for (auto _ : state) benchmark::DoNotOptimize(cutWithDecodeItem(in));
  reportRates(state, items, in.size());
}

void BM_CutWithOpenSSL(benchmark::State& state, Buffer which) {
  const Bytes& in = buffer(which);
  const std::size_t items = cutWithOpenSSL(in);
  if (items == 0) {
    state.SkipWithError("buffer does not decode");
    return;
  }
  for (auto _ : state) benchmark::DoNotOptimize(cutWithOpenSSL(in));
  reportRates(state, items, in.size());
}

BENCHMARK_CAPTURE(BM_CutWithDecodeItem, many_small, Buffer::kManySmall);
BENCHMARK_CAPTURE(BM_CutWithOpenSSL, many_small, Buffer::kManySmall);
BENCHMARK_CAPTURE(BM_CutWithDecodeItem, few_large, Buffer::kFewLarge);
BENCHMARK_CAPTURE(BM_CutWithOpenSSL, few_large, Buffer::kFewLarge);
BENCHMARK_CAPTURE(BM_CutWithDecodeItem, token_blob, Buffer::kTokenBlob);
BENCHMARK_CAPTURE(BM_CutWithOpenSSL, token_blob, Buffer::kTokenBlob);

#if defined(ZLKA_BENCH_TOKEN_ARRAY)
void BM_CutWithParseTokenArray(benchmark::State& state, Buffer which) {
  const Bytes& in = buffer(which);
  const std::optional<platform::Data> data = platform::Data(in.data(), in.size());
  const auto tokens = parseTokenArray(data);
  if (!tokens) {
    state.SkipWithError("buffer does not parse");
    return;
  }
  for (auto _ : state) benchmark::DoNotOptimize(parseTokenArray(data));
  reportRates(state, tokens->size(), in.size());
}

BENCHMARK_CAPTURE(BM_CutWithParseTokenArray, many_small, Buffer::kManySmall);
BENCHMARK_CAPTURE(BM_CutWithParseTokenArray, few_large, Buffer::kFewLarge);
BENCHMARK_CAPTURE(BM_CutWithParseTokenArray, token_blob, Buffer::kTokenBlob);
#endif

// Walks a SEQUENCE of range(0) small INTEGERs.
void BM_WalkSequence(benchmark::State& state) {
  Bytes content;
  for (std::int64_t i = 0; i < state.range(0); ++i) {
    append(content, tlv(0x02, {0x01, static_cast<std::uint8_t>(i & 0x7F)}));
  }
  const Bytes in = tlv(0x30, content);
  for (auto _ : state) {
    DERTag tag = 0;
    DERSeqCursor cursor;
    if (DERDecodeSeqInit(DERSlice{in.data(), in.size()}, &tag, &cursor) != DER_STATUS_OK) {
      state.SkipWithError("not a sequence");
      break;
    }
    DERDecodedItem item;
    std::size_t count = 0;
    while (DERDecodeSeqNext(&cursor, &item) == DER_STATUS_OK) ++count;
    benchmark::DoNotOptimize(count);
  }
  reportRates(state, static_cast<std::size_t>(state.range(0)), in.size());
}
BENCHMARK(BM_WalkSequence)->Arg(4)->Arg(4096);

struct TokenRecord {
  DERSlice identifier;
  DERSlice plan;
  DERSlice issued;
  DERSlice note;  // optional, absent
  DERSlice serial;
  DERSlice payload;
  DERSlice signature;
};

const DERFieldSpec kTokenRecordFields[] = {
    {offsetof(TokenRecord, identifier), DER_TAG_UTF8_STRING, 0},
    {offsetof(TokenRecord, plan), DER_TAG_UTF8_STRING, 0},
    {offsetof(TokenRecord, issued), DER_TAG_GENERALIZED_TIME, DER_FIELD_KEEP_HEADER},
    {offsetof(TokenRecord, note), DER_TAG_CLASS_CONTEXT_SPECIFIC | 0, DER_FIELD_OPTIONAL},
    {offsetof(TokenRecord, serial), DER_TAG_INTEGER, 0},
    {offsetof(TokenRecord, payload), DER_TAG_OCTET_STRING, 0},
    {offsetof(TokenRecord, signature), DER_TAG_BIT_STRING, 0},
};
constexpr std::uint16_t kTokenRecordFieldCount = sizeof kTokenRecordFields / sizeof kTokenRecordFields[0];

// Fills a record from the first SEQUENCE of the token blob by a template.
void BM_ParseSequenceTemplate(benchmark::State& state) {
  const Bytes& in = buffer(Buffer::kTokenBlob);
  const DERSlice input{in.data(), in.size()};
  TokenRecord record;
  if (DERParseSequence(input, kTokenRecordFieldCount, kTokenRecordFields, &record, sizeof record) != DER_STATUS_OK) {
    state.SkipWithError("template does not fit the record");
    return;
  }
  for (auto _ : state) {
    benchmark::DoNotOptimize(
        DERParseSequence(input, kTokenRecordFieldCount, kTokenRecordFields, &record, sizeof record));
    benchmark::DoNotOptimize(record);
  }
}
BENCHMARK(BM_ParseSequenceTemplate);

void BM_ParseInteger64NineBytes(benchmark::State& state) {
  const Bytes in{0x00, 0xFF, 0xEE, 0xDD, 0xCC, 0xBB, 0xAA, 0x99, 0x88};
  for (auto _ : state) {
    std::uint64_t value = 0;
    benchmark::DoNotOptimize(DERParseInteger64(DERSlice{in.data(), in.size()}, &value));
    benchmark::DoNotOptimize(value);
  }
}
BENCHMARK(BM_ParseInteger64NineBytes);

}  // namespace

BENCHMARK_MAIN();
