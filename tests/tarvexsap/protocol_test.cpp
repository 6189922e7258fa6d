// What device and server compute alike: the transcript hash, the key split and the message
// signatures (against values worked out apart from this code, with Python's hashlib and hmac, so
// that a mistake both sides share cannot hide behind their agreement), and the replay window.
// That every byte of a signature and its body counts is the fuzz targets' property.
#include <gtest/gtest.h>

#include <limits>

#include "tarvexsap/tsap_protocol.h"
#include "tarvexsap/tsap_replay_window.h"
#include "tsap_test_support.h"

using namespace tsaptest;
using tsap::Direction;

namespace {

template <typename Range>
Bytes bytes(const Range& range) {
  return Bytes(range.begin(), range.end());
}

TEST(ProtocolTest, TranscriptKeysAndSignaturesMatchKnownAnswers) {
  tsap::RequestBytes request{};
  tsap::SessionInfoBytes info{};
  tsap::Secret<32> z;
  std::array<uint8_t, 32> clientNonce{}, serverNonce{};
  for (std::size_t i = 0; i < info.size(); ++i) {
    info[i] = static_cast<uint8_t>(0x80 + i);
    request[i % request.size()] = static_cast<uint8_t>(i % request.size());
    z.data()[i % 32] = static_cast<uint8_t>(0xA0 + i % 32);
    clientNonce[i % 32] = static_cast<uint8_t>(0x40 + i % 32);
    serverNonce[i % 32] = static_cast<uint8_t>(0x60 + i % 32);
  }
  tsap::Digest t{};
  ASSERT_TRUE(tsap::transcriptHash(request, info, t));
  EXPECT_EQ(bytes(t), fromHex("05cc832205a9c1db9caa2f9737f20b4b958973357863c74fde330d3a043e1be2"));
  tsap::SessionKeys keys;
  ASSERT_TRUE(tsap::deriveSessionKeys(z, clientNonce, serverNonce, t, keys));
  EXPECT_EQ(bytes(keys.request.span()), fromHex("5e07501a810dc1f4971303126c4752876fc612578b23fc8b049fc6e74f487a9a"));
  EXPECT_EQ(bytes(keys.response.span()), fromHex("6c633c0c0fdfb9b5e6174b12aa9c83530ee997c2329d6640d46246c9763f0017"));

  const struct {
    Direction direction;
    uint64_t seq;
    const char* data;
    const char* signature;
  } rows[] = {
      {Direction::request, 0x0102030405060708, "body",
       "0102030405060708e02802554bd5cb0f6efb4f3ab8f6f1d33de31299a3a946b36f75ca67db0296c8"},
      {Direction::response, 0x0102030405060708, "body",
       "010203040506070890d969729113144ed75314de742aaa41ce2e642a64bfe644ba6f3c251fcd4a55"},
      {Direction::response, 1, "", "00000000000000019b406b6a6f0a124874222f77cd5c017804537cc6e529d93af956d004dc9160cf"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.signature);
    const Bytes data = bytesOf(row.data);
    tsap::SignatureBytes signature{};
    ASSERT_TRUE(tsap::signMessage(keys, row.direction, row.seq, data, signature));
    EXPECT_EQ(bytes(signature), fromHex(row.signature));
    uint64_t seq = 0;
    EXPECT_TRUE(tsap::checkMessage(keys, row.direction, signature, data, seq));
    EXPECT_EQ(seq, row.seq);
    // Keys and labels differ by direction: a request never passes as a response.
    const Direction other = row.direction == Direction::request ? Direction::response : Direction::request;
    EXPECT_FALSE(tsap::checkMessage(keys, other, signature, data, seq));
  }
}

constexpr uint64_t kTop = std::numeric_limits<uint64_t>::max();

struct WindowCase {
  const char* name;
  uint64_t prefill;  // 1..prefill accepted first
  std::vector<std::pair<uint64_t, bool>> steps;
};

// The window covers the 1024 numbers ending at the highest accepted one.
const WindowCase kWindows[] = {
    {"zero is never valid", 0, {{0, false}, {1, true}, {0, false}}},
    {"inside the window, each once", 0, {{5, true}, {5, false}, {3, true}, {3, false}, {4, true}, {6, true}}},
    {"the lowest inside and the highest below",
     0,
     {{5000, true}, {3977, true}, {3976, false}, {5001, true}, {3977, false}}},
    {"a jump of a whole window forgets all", 0, {{5, true}, {2000, true}, {1029, true}, {1029, false}, {976, false}}},
    {"a gap survives a slide over it", 0, {{10, true}, {1030, true}, {7, true}, {6, false}, {10, false}, {11, true}}},
    {"slots are freed as the window slides", 1024, {{1026, true}, {1025, true}, {1025, false}, {3, false}, {2, false}}},
    {"the top of the sequence space", 0, {{kTop, true}, {kTop, false}, {kTop - 1023, true}, {kTop - 1024, false}}},
};

TEST(ReplayWindowTest, AcceptsEachSeqOnceWithinTheWindow) {
  for (const WindowCase& c : kWindows) {
    tsap::ReplayWindow window;
    for (uint64_t seq = 1; seq <= c.prefill; ++seq) {
      ASSERT_TRUE(window.accept(seq)) << c.name << ": prefill " << seq;
    }
    for (const auto& [seq, accepted] : c.steps) {
      EXPECT_EQ(window.accept(seq), accepted) << c.name << ": seq " << seq;
    }
  }
}

}  // namespace
