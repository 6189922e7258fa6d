#include <gtest/gtest.h>

#include <mutex>
#include <regex>

#include "network/token_array.h"
#include "platform/log.h"

using platform::Data;

namespace {

Data bytes(std::initializer_list<int> b) {
  std::vector<uint8_t> v;
  for (int x : b) v.push_back(static_cast<uint8_t>(x));
  return Data(std::move(v));
}

// A SEQUENCE whose contents are `n` bytes, with a long-form length when n >= 128.
std::vector<uint8_t> sequence(size_t n, uint8_t fill = 0x5A) {
  std::vector<uint8_t> v = {0x30};
  if (n < 128) {
    v.push_back(static_cast<uint8_t>(n));
  } else if (n < 256) {
    v.insert(v.end(), {0x81, static_cast<uint8_t>(n)});
  } else {
    v.insert(v.end(), {0x82, static_cast<uint8_t>(n >> 8), static_cast<uint8_t>(n)});
  }
  v.insert(v.end(), n, fill);
  return v;
}

std::vector<uint8_t> concat(std::initializer_list<std::vector<uint8_t>> parts) {
  std::vector<uint8_t> out;
  for (const auto& p : parts) out.insert(out.end(), p.begin(), p.end());
  return out;
}

}  // namespace

TEST(ParseTokenArray, OneLongFormItemIsTakenWhole) {
  auto seq = sequence(296);  // 300 bytes with a two-byte long-form length
  ASSERT_EQ(seq.size(), 300u);
  auto tokens = parseTokenArray(Data(seq));
  ASSERT_TRUE(tokens);
  ASSERT_EQ(tokens->size(), 1u);
  EXPECT_EQ((*tokens)[0].toVector(), seq);
}

TEST(ParseTokenArray, ItemsBackToBackComeOutInOrderAndConcatenateToTheInput) {
  auto a = sequence(3, 1), b = std::vector<uint8_t>{0x04, 0x00}, c = std::vector<uint8_t>{0xDF, 0x82, 0x01, 0x01, 0x07};
  auto input = concat({a, b, c});
  auto tokens = parseTokenArray(Data(input));
  ASSERT_TRUE(tokens);
  ASSERT_EQ(tokens->size(), 3u);
  EXPECT_EQ((*tokens)[0].toVector(), a);
  EXPECT_EQ((*tokens)[1].toVector(), b);  // an empty item keeps its identifier and length
  EXPECT_EQ((*tokens)[2].toVector(), c);  // high-tag-number private constructed: tags are not checked
}

TEST(ParseTokenArray, ItemsAreCopiesThatOutliveTheInput) {
  std::optional<std::vector<Data>> tokens;
  {
    Data input(sequence(10, 7));
    tokens = parseTokenArray(input);
  }
  ASSERT_TRUE(tokens);
  EXPECT_EQ((*tokens)[0].toVector(), sequence(10, 7));
}

TEST(ParseTokenArray, OneTrailingByteIsIgnoredButTwoMustFormAnItem) {
  auto item = sequence(4);
  auto one = parseTokenArray(Data(concat({item, {0xFF}})));
  ASSERT_TRUE(one);
  ASSERT_EQ(one->size(), 1u);
  EXPECT_EQ((*one)[0].toVector(), item);
  EXPECT_FALSE(parseTokenArray(Data(concat({item, {0x04, 0x05}}))));
  EXPECT_FALSE(parseTokenArray(Data(concat({item, item, {0x30}, {0x30}}))));
  // Two trailing bytes that do form an (empty) item are a third token.
  auto two = parseTokenArray(Data(concat({item, {0x05, 0x00}})));
  ASSERT_TRUE(two);
  EXPECT_EQ(two->size(), 2u);
}

TEST(ParseTokenArray, EdgeLengths) {
  EXPECT_FALSE(parseTokenArray(std::nullopt));
  EXPECT_FALSE(parseTokenArray(Data()));
  auto single = parseTokenArray(bytes({0x30}));
  ASSERT_TRUE(single);  // the walk never starts on one byte
  EXPECT_TRUE(single->empty());
}

TEST(ParseTokenArray, MalformedItemsFailTheWholeBlob) {
  auto good = sequence(2);
  EXPECT_FALSE(parseTokenArray(Data(concat({good, {0x30, 0x05, 0x01, 0x02}}))));  // overruns what remains
  EXPECT_FALSE(parseTokenArray(bytes({0x30, 0x80, 0x00, 0x00})));                 // indefinite length
  EXPECT_FALSE(parseTokenArray(bytes({0x04, 0x81, 0x00})));                       // leading zero length byte
  EXPECT_FALSE(parseTokenArray(bytes({0x1F, 0x1E, 0x00})));                       // short tag in high form
  auto lenient = parseTokenArray(bytes({0x04, 0x81, 0x02, 0xAA, 0xBB}));          // long form below 128
  ASSERT_TRUE(lenient);
  EXPECT_EQ(lenient->size(), 1u);
}

TEST(ParseTokenArray, DebugLinesMaskPointersAndReportEachItem) {
  std::mutex mutex;
  std::vector<std::string> lines;
  platform::configureLog({platform::LogLevel::Debug, false, platform::LogBackend::Stderr, "test"});
  platform::setLogSink([&](const platform::LogEntry& e) {
    std::lock_guard lock(mutex);
    lines.push_back(e.message);
  });
  Data input(concat({sequence(1), sequence(2)}));
  ASSERT_TRUE(parseTokenArray(input));
  platform::setLogSink({});
  platform::configureLog({});

  char real[32];
  std::snprintf(real, sizeof real, "0x%lx", static_cast<unsigned long>(reinterpret_cast<uintptr_t>(input.bytes())));
  int itemLengths = 0, rets = 0;
  for (const auto& l : lines) {
    EXPECT_EQ(l.find(real), std::string::npos) << l;
    if (l == "[#TokenAuth] itemLength: 3" || l == "[#TokenAuth] itemLength: 4") ++itemLengths;
    if (l == "[#TokenAuth] ret: 0") ++rets;
  }
  EXPECT_EQ(itemLengths, 2);
  EXPECT_EQ(rets, 2);
  EXPECT_EQ(lines.front(), "[#TokenAuth] tokens: <private>");
  EXPECT_EQ(lines[1], "[#TokenAuth] tokens.length: 7");
  EXPECT_TRUE(std::regex_match(lines[2], std::regex(R"(\[#TokenAuth\] pItemBegin: 0x[0-9a-f]+)")));
  EXPECT_EQ(lines.back(), "[#TokenAuth] tokenArray: <private>");
}
