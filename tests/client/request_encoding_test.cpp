// What the client puts on the wire: the a{sv} keys and the exact D-Bus type of every value, keys
// left out when arguments are absent, and values refused before they reach the bus.
#include <cstdint>
#include <limits>

#include "client/bus_names.h"
#include "client_fixture.h"

namespace client_test {
namespace {

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Value;
using zlka_client::ClientErrorCode;
using zlka_client::MetadataArguments;
using zlka_client::TokenArguments;

Data bytes(std::initializer_list<uint8_t> list) { return Data(std::vector<uint8_t>(list)); }

Value nested(int levels) {
  Value v = Dictionary{{"leaf", true}};
  for (int i = 1; i < levels; ++i) v = Dictionary{{"in", v}};
  return v;
}

void expectInvalidRequest(const platform::Error& error, const std::string& mentions) {
  EXPECT_EQ(error.domain(), zlka_client::kClientErrorDomain);
  EXPECT_EQ(error.code(), static_cast<int64_t>(ClientErrorCode::InvalidRequest));
  EXPECT_NE(error.localizedDescription().find(mentions), std::string::npos) << error.localizedDescription();
}

TEST_F(ClientBusTest, MetadataSendsEveryArgumentWithItsWireType) {
  Dictionary info{
      {"flag", true},
      {"name", "x"},
      {"count", int64_t{-3}},
      {"small", uint64_t{5}},
      {"int64max", static_cast<uint64_t>(std::numeric_limits<int64_t>::max())},
      {"above", static_cast<uint64_t>(std::numeric_limits<int64_t>::max()) + 1},
      {"ratio", 1.5},
      {"blob", bytes({1, 2})},
      {"list", Array{Value(1), Value("a"), Value(false)}},
      {"nested", Dictionary{{"k", false}, {"n", Array{}}}},
      {"empty", Dictionary{}},
  };
  auto answer = client->requestMetadata({bytes({0x0a, 0xff}), "U-1", "en_US", info});
  ASSERT_TRUE(answer.ok()) << answer.error().description();
  EXPECT_EQ(answer.value().ppid, "ppid-1");
  EXPECT_EQ(answer.value().locale, "en_US");
  EXPECT_EQ(answer.value().metadata, Value(Dictionary{{"plan", "basic"}, {"seats", 2}}));

  auto call = service->lastCall();
  ASSERT_TRUE(call);
  EXPECT_EQ(call->interface, zlka_client::kInterfaceName);
  EXPECT_EQ(call->member, "RequestMetadataForToken");
  EXPECT_EQ(call->arguments,
            "a{sv}[s:\"token\"=<ay:0aff>,s:\"uuid\"=<s:\"U-1\">,s:\"requestedLocale\"=<s:\"en_US\">,"
            "s:\"requestInfo\"=<a{sv}["
            "s:\"above\"=<t:9223372036854775808>,"
            "s:\"blob\"=<ay:0102>,"
            "s:\"count\"=<x:-3>,"
            "s:\"empty\"=<a{sv}[]>,"
            "s:\"flag\"=<b:true>,"
            "s:\"int64max\"=<x:9223372036854775807>,"
            "s:\"list\"=<av[<x:1>,<s:\"a\">,<b:false>]>,"
            "s:\"name\"=<s:\"x\">,"
            "s:\"nested\"=<a{sv}[s:\"k\"=<b:false>,s:\"n\"=<av[]>]>,"
            "s:\"ratio\"=<d:1.5>,"
            "s:\"small\"=<x:5>]>]");
}

TEST_F(ClientBusTest, AbsentArgumentsAreKeysNotSent) {
  ASSERT_TRUE(client->requestMetadata({}).ok());
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[]");

  MetadataArguments onlyLocale;
  onlyLocale.requestedLocale = "fr_FR";
  ASSERT_TRUE(client->requestMetadata(onlyLocale).ok());
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"requestedLocale\"=<s:\"fr_FR\">]");

  // Present but empty is not absent.
  ASSERT_TRUE(client->requestMetadata({Data(), "", std::nullopt, Dictionary{}}).ok());
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"token\"=<ay:>,s:\"uuid\"=<s:\"\">,s:\"requestInfo\"=<a{sv}[]>]");

  ASSERT_TRUE(client->requestActivation({}).ok());
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[]");
  ASSERT_TRUE(client->confirmActivation({std::nullopt, "U"}).ok());
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"uuid\"=<s:\"U\">]");
}

TEST_F(ClientBusTest, ActivationAndConfirmationSendTokenAndUUID) {
  auto token = client->requestActivation({bytes({1, 2, 3}), "U-2"});
  ASSERT_TRUE(token.ok()) << token.error().description();
  EXPECT_EQ(token.value(), bytes({0xde, 0xad, 0xbe, 0xef}));
  EXPECT_EQ(service->lastCall()->member, "RequestActivationForToken");
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"token\"=<ay:010203>,s:\"uuid\"=<s:\"U-2\">]");

  auto confirmed = client->confirmActivation({bytes({4}), "U-3"});
  ASSERT_TRUE(confirmed.ok()) << confirmed.error().description();
  EXPECT_EQ(service->lastCall()->member, "ConfirmActivationForToken");
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"token\"=<ay:04>,s:\"uuid\"=<s:\"U-3\">]");
}

TEST_F(ClientBusTest, UnsendableArgumentsNeverReachTheBus) {
  struct Case {
    MetadataArguments arguments;
    std::string mentions;
  };
  std::vector<Case> cases = {
      {{std::nullopt, std::nullopt, std::nullopt, Dictionary{{"gone", Value()}}}, "requestInfo.gone is null"},
      {{std::nullopt, std::nullopt, std::nullopt, Dictionary{{"a", Array{Value(1), Value()}}}}, "requestInfo.a[1] is null"},
      {{std::nullopt, std::nullopt, std::nullopt, Dictionary{{"d", Dictionary{{"e", Value()}}}}}, "requestInfo.d.e is null"},
      {{std::nullopt, std::nullopt, std::nullopt, Dictionary{{"fd", platform::Opaque{"file descriptor"}}}}, "file descriptor"},
      {{std::nullopt, std::nullopt, std::nullopt, Dictionary{{"s", std::string("\xff\xfe")}}}, "requestInfo.s is not a UTF-8"},
      {{std::nullopt, std::nullopt, std::nullopt, Dictionary{{std::string("k\xc0\x80"), 1}}}, "has a key that is not"},
      {{std::nullopt, std::string("a\0b", 3), std::nullopt, std::nullopt}, "uuid"},
      {{std::nullopt, std::nullopt, std::string("en\xed\xa0\x80"), std::nullopt}, "requestedLocale"},
      {{std::nullopt, std::nullopt, std::nullopt, *nested(zlka_client::kMaxRequestInfoDepth + 1).dictionary()}, "nested too deeply"},
  };
  for (const Case& c : cases) {
    auto answer = client->requestMetadata(c.arguments);
    ASSERT_FALSE(answer.ok()) << c.mentions;
    expectInvalidRequest(answer.error(), c.mentions);
  }
  auto activation = client->requestActivation({std::nullopt, std::string("\x80")});
  ASSERT_FALSE(activation.ok());
  expectInvalidRequest(activation.error(), "uuid");

  Answers<zlka_client::MetadataReply> async(1);
  client->requestMetadataAsync(cases.front().arguments, async.callback());
  async.wait();
  ASSERT_FALSE(async.results()[0].ok());
  expectInvalidRequest(async.results()[0].error(), "requestInfo.gone is null");
  EXPECT_NE(async.threads()[0], std::this_thread::get_id());

  EXPECT_TRUE(service->calls().empty());
}

TEST_F(ClientBusTest, DeepestAllowedRequestInfoIsAcceptedByTheBus) {
  Dictionary deepest = *nested(zlka_client::kMaxRequestInfoDepth).dictionary();
  ASSERT_EQ(zlka_client::unsendableReason(Value(deepest), "requestInfo"), std::nullopt);
  auto answer = client->requestMetadata({std::nullopt, std::nullopt, std::nullopt, deepest});
  ASSERT_TRUE(answer.ok()) << answer.error().description();
  std::string expected = "<b:true>";
  expected = "s:\"leaf\"=" + expected;
  for (int i = 1; i < zlka_client::kMaxRequestInfoDepth; ++i) expected = "s:\"in\"=<a{sv}[" + expected + "]>";
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"requestInfo\"=<a{sv}[" + expected + "]>]");
}

TEST_F(ClientBusTest, RawCallsSendWhateverTheWriterAppends) {
  // A key of the wrong type and an unknown key, which the daemon's messaging layer must refuse.
  auto answer = client->callRaw("RequestActivationForToken", [](sd_bus_message* m) {
    return sd_bus_message_append(m, "a{sv}", 2, "token", "s", "not bytes", "color", "u", 7u);
  });
  ASSERT_TRUE(answer.ok()) << answer.error().description();
  EXPECT_EQ(answer.value(), (Array{Value(bytes({0xde, 0xad, 0xbe, 0xef}))}));
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"token\"=<s:\"not bytes\">,s:\"color\"=<u:7>]");

  ASSERT_TRUE(client->callRaw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "si", "x", 1); }).ok());
  EXPECT_EQ(service->lastCall()->arguments, "s:\"x\" i:1");

  auto refused = client->callRaw("ConfirmActivationForToken", [](sd_bus_message*) { return -EINVAL; });
  ASSERT_FALSE(refused.ok());
  EXPECT_EQ(refused.error().code(), static_cast<int64_t>(ClientErrorCode::InvalidRequest));
  EXPECT_EQ(service->calls().size(), 2u);
}

TEST(BusStringTest, AcceptsOnlyWellFormedUTF8WithoutNUL) {
  using zlka_client::isBusString;
  for (const char* good : {"", "plain", "caf\xc3\xa9", "\xe2\x82\xac", "\xf0\x9f\x98\x80", "\xf4\x8f\xbf\xbf", "\xed\x9f\xbf"})
    EXPECT_TRUE(isBusString(good)) << good;
  const std::string bad[] = {
      std::string("a\0b", 3),  // NUL
      "\xc0\x80",              // overlong NUL
      "\xe0\x80\xaf",          // overlong '/'
      "\xf0\x8f\xbf\xbf",      // overlong U+FFFF
      "\xed\xa0\x80",          // UTF-16 surrogate
      "\xf4\x90\x80\x80",      // above U+10FFFF
      "\xc3",                  // truncated
      "\xe2\x82",              // truncated
      "\x80",                  // stray continuation byte
      "\xc3\x28",              // continuation byte missing
      "\xff",
  };
  for (const std::string& text : bad) EXPECT_FALSE(isBusString(text)) << testing::PrintToString(text);
}

}  // namespace
}  // namespace client_test
