// parseTokenArray: a run of DER items written back to back, cut into copies of each item's whole
// encoding. Tags are not checked; one trailing byte is ignored; anything else that does not decode
// fails the whole blob. That whatever parses is the input cut in order, and that no input or an
// empty one never parses, are fuzz_token_array's property (its corpus replays as a test).
#include "network/token_array.h"

#include <gtest/gtest.h>

#include "common/log_capture.h"

namespace {

using Bytes = std::vector<uint8_t>;

// A SEQUENCE of `n` content bytes, with a long-form length from 128 on.
Bytes sequence(size_t n) {
  Bytes v(n, 0x5A);
  v.insert(v.begin(), static_cast<uint8_t>(n));
  if (n >= 256) v.insert(v.begin(), static_cast<uint8_t>(n >> 8));
  if (n >= 128) v.insert(v.begin(), n >= 256 ? 0x82 : 0x81);
  v.insert(v.begin(), 0x30);
  return v;
}

Bytes operator+(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

struct Row {
  const char* name;
  Bytes input;
  std::optional<std::vector<size_t>> lengths;  // of the items; nullopt: refused
};

// clang-format off
const Row kRows[] = {
  {"OneLongFormItem", sequence(296), {{300}}},
  // An empty item keeps its identifier and length; a private constructed high tag is taken as any other.
  {"ItemsBackToBack", sequence(3) + Bytes{0x04, 0x00} + Bytes{0xDF, 0x82, 0x01, 0x01, 0x07}, {{5, 2, 5}}},
  {"OneTrailingByteIsIgnored", sequence(4) + Bytes{0xFF}, {{6}}},
  {"TwoTrailingBytesMustFormAnItem", sequence(4) + Bytes{0x04, 0x05}, std::nullopt},
  {"TwoTrailingBytesThatFormAnItem", sequence(4) + Bytes{0x05, 0x00}, {{6, 2}}},
  {"OneByteAlone", {0x30}, {{}}},
  {"ItemOverrunsTheData", sequence(2) + Bytes{0x30, 0x05, 0x01, 0x02}, std::nullopt},
  {"IndefiniteLength", {0x30, 0x80, 0x00, 0x00}, std::nullopt},
  {"LongFormLengthWithoutItsByte", {0x04, 0x81}, std::nullopt},
  {"LowTagInHighForm", {0x1F, 0x1E, 0x00}, std::nullopt},
  // Lenient: a long-form length below 128 is taken.
  {"LongFormBelow128", {0x04, 0x81, 0x02, 0xAA, 0xBB}, {{5}}},
};
// clang-format on

TEST(ParseTokenArray, CutsTheDataIntoItsItems) {
  for (const Row& row : kRows) {
    std::optional<std::vector<platform::Data>> items = parseTokenArray(platform::Data(row.input));
    ASSERT_EQ(items.has_value(), row.lengths.has_value()) << row.name;
    std::vector<size_t> lengths;
    Bytes joined;  // read after the input has gone: the items are copies
    for (const platform::Data& item : items.value_or(std::vector<platform::Data>{}))
      lengths.push_back(item.length()), joined = joined + item.toVector();
    EXPECT_EQ(lengths, row.lengths.value_or(std::vector<size_t>{})) << row.name;
    EXPECT_EQ(joined, Bytes(row.input.begin(), row.input.begin() + static_cast<long>(joined.size()))) << row.name;
  }
}

// Tokens are cut on every request: their debug lines show the walk with masked addresses only.
TEST(ParseTokenArray, DebugLinesNeverShowAnAddress) {
  zlkatest::LogCapture log;
  const platform::Data input(sequence(1) + sequence(2));
  ASSERT_TRUE(parseTokenArray(input));
  char address[32];
  std::snprintf(address, sizeof address, "0x%lx",
                static_cast<unsigned long>(reinterpret_cast<uintptr_t>(input.bytes())));
  EXPECT_GT(log.countStartingWith("[#TokenAuth] pItemBegin: 0x"), 0) << "the walk is not logged";
  for (const auto& e : log.entries()) EXPECT_EQ(e.message.find(address), std::string::npos) << e.message;
}

}  // namespace
