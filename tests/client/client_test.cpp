// The client library: how bus errors map back to domains and codes, what each kind of argument
// puts on the wire and what is refused before it, how answers are decoded, how calls end that can
// get no answer, and on which thread and how often callbacks run.
#include <gmock/gmock.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <limits>
#include <map>

#include "echo_service.h"
#include "zlkactl/commands.h"

namespace client_test {
namespace {

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Error;
using platform::Value;
using testing::HasSubstr;
using zlka_client::ZLKAClient;

constexpr char kOperation[] = "ZLKATokenManagerErrorDomain";
constexpr char kClient[] = "ZLKAClientErrorDomain";

Data bytes(std::vector<uint8_t> list) { return Data(std::move(list)); }

// Request info nested `levels` dictionaries deep, the innermost {"leaf": true}.
Dictionary nested(int levels) {
  Dictionary d{{"leaf", true}};
  while (--levels > 0) d = Dictionary{{"in", d}};
  return d;
}

TEST(ClientErrors, BusErrorsMapBackToDomainAndCode) {
  const std::string op = "com.kestro.ZLKAuthentication.Error.", bus = "org.freedesktop.DBus.Error.";
  const std::pair<const char*, int64_t> operationErrors[] = {{"Unknown", -1}, {"MissingEntitlement", -2}, {"InvalidParameter", -3},
                                                             {"Internal", -4}, {"Network", -5}, {"Server", -6}};
  for (const auto& [name, code] : operationErrors) {  // exactly the daemon's error, nothing added; zlkactl exits 1
    Error e = zlka_client::errorFromBusError(op + name, "the message");
    EXPECT_EQ(e, Error(kOperation, code, Dictionary{{platform::LocalizedDescriptionKey, "the message"}})) << name;
    EXPECT_EQ(zlkactl::exitStatusFor(e), 1) << name;
  }
  EXPECT_EQ(zlka_client::errorFromBusError(op + "Server", ""), Error(kOperation, -6));  // the description is the error's own
  // Any other name stays in the client domain with its name and message: a refusal (code 4, zlkactl
  // exits 1) or, where nothing answered, the service unreachable (code 2, zlkactl exits 3).
  const std::pair<std::string, int64_t> otherErrors[] = {
      {op + "Bogus", 4}, {op, 4}, {bus + "InvalidArgs", 4}, {bus + "AccessDenied", 4}, {bus + "ServiceUnknown", 2},
      {bus + "NameHasNoOwner", 2}, {bus + "NoReply", 2}, {bus + "Timeout", 2}, {bus + "TimedOut", 2},
      {bus + "Disconnected", 2}, {bus + "NoServer", 2}, {bus + "NoNetwork", 2}, {bus + "Spawn.ExecFailed", 2}};
  for (const auto& [name, code] : otherErrors) {
    Error e = zlka_client::errorFromBusError(name, "the message");
    EXPECT_THAT(shown(e), testing::StartsWith(kClient + (" " + std::to_string(code)))) << name;
    EXPECT_THAT(e.localizedDescription(), HasSubstr(name + ": the message"));
    EXPECT_EQ(*e.userInfo()->at(zlka_client::kBusErrorNameKey).string(), name);
    EXPECT_EQ(*e.userInfo()->at(zlka_client::kBusErrorMessageKey).string(), "the message");
    EXPECT_EQ(zlkactl::exitStatusFor(e), code == 2 ? 3 : 1) << name;
  }
  // Failures to send: arguments that cannot be encoded are the caller's fault (zlkactl exits 2).
  for (int e : {EINVAL, EBADMSG, E2BIG, EMSGSIZE}) EXPECT_EQ(zlkactl::exitStatusFor(zlka_client::errorFromSendFailure(-e)), 2) << e;
  for (int e : {ENOTCONN, ECONNRESET}) EXPECT_EQ(zlkactl::exitStatusFor(zlka_client::errorFromSendFailure(-e)), 3) << e;
  EXPECT_EQ(zlkactl::exitStatusFor(zlka_client::clientError(zlka_client::ClientErrorCode::ConnectionFailed, "")), 3);
  EXPECT_EQ(zlkactl::exitStatusFor(zlka_client::clientError(zlka_client::ClientErrorCode::Cancelled, "")), 1);
}

TEST(ClientErrors, BusStringsAreWellFormedUTF8WithoutNUL) {
  // Each boundary of the encoding: 1-, 2-, 3- and 4-byte forms, around the surrogates, U+10FFFF.
  for (const char* good : {"", "\x7f", "\xc2\x80", "\xdf\xbf", "\xe0\xa0\x80", "\xed\x9f\xbf", "\xee\x80\x80",
                           "\xef\xbf\xbf", "\xf0\x90\x80\x80", "\xf1\x80\x80\x80", "\xf4\x8f\xbf\xbf", "caf\xc3\xa9"})
    EXPECT_TRUE(zlka_client::isBusString(good)) << testing::PrintToString(std::string(good));
  for (const std::string& bad : {std::string("a\0b", 3), std::string("\xc0\x80"), std::string("\xc1\xbf"),  // NUL, overlong
                                std::string("\xe0\x9f\xbf"), std::string("\xf0\x8f\xbf\xbf"),                // overlong
                                std::string("\xed\xa0\x80"), std::string("\xed\xbf\xbf"),                    // surrogates
                                std::string("\xf4\x90\x80\x80"), std::string("\xf5\x80\x80\x80"),            // past U+10FFFF
                                std::string("\xc3"), std::string("\xf0\x9f\x98"), std::string("\xc3\x28"),   // cut short
                                std::string("\x80"), std::string("\xff")})                                   // no lead byte
    EXPECT_FALSE(zlka_client::isBusString(bad)) << testing::PrintToString(bad);
}

TEST_F(ClientTest, CallsSendExactlyTheirArgumentsAndDecodeTheAnswer) {
  const uint64_t int64Max = std::numeric_limits<int64_t>::max();
  const Dictionary info{{"flag", true}, {"name", "x"}, {"count", int64_t{-3}}, {"small", uint64_t{5}}, {"int64max", int64Max},
                        {"above", int64Max + 1}, {"ratio", 1.5}, {"blob", bytes({1, 2})},
                        {"list", Array{Value(1), Value("a")}}, {"nested", Dictionary{{"n", Array{}}}}};
  std::string deepest = "s:\"leaf\"=<b:true>", tooDeep = "requestInfo";
  for (int i = 0; i < zlka_client::kMaxRequestInfoDepth; ++i) tooDeep += ".in";
  for (int i = 1; i < zlka_client::kMaxRequestInfoDepth; ++i) deepest = "s:\"in\"=<a{sv}[" + deepest + "]>";
  auto metadata = [](zlka_client::MetadataArguments a) { return [a](ZLKAClient& c) { return shown(c.requestMetadata(a)); }; };
  auto activation = [](zlka_client::TokenArguments a) { return [a](ZLKAClient& c) { return shown(c.requestActivation(a)); }; };
  auto confirmation = [](zlka_client::TokenArguments a) { return [a](ZLKAClient& c) { return shown(c.confirmActivation(a)); }; };
  auto raw = [](const char* method, ZLKAClient::ArgumentWriter w) { return [=](ZLKAClient& c) { return shown(c.callRaw(method, w)); }; };
  auto reply = [](auto... arguments) { return [=](sd_bus_message* m) { return sd_bus_reply_method_return(m, arguments...) >= 0; }; };
  const std::string refused = "ZLKAClientErrorDomain 3: Cannot send the call: ", malformed = "ZLKAClientErrorDomain 5: The service's answer is malformed: ";
  // clang-format off
  const struct { const char* what; EchoService::Answer answer; std::function<std::string(ZLKAClient&)> call; std::string sent, result; } rows[] = {
      {"every kind of argument", nullptr, metadata({bytes({0x0a, 0xff}), "U-1", "en_US", info}),
       "RequestMetadataForToken a{sv}[s:\"token\"=<ay:0aff>,s:\"uuid\"=<s:\"U-1\">,s:\"requestedLocale\"=<s:\"en_US\">,s:\"requestInfo\"=<a{sv}["
       "s:\"above\"=<t:9223372036854775808>,s:\"blob\"=<ay:0102>,s:\"count\"=<x:-3>,s:\"flag\"=<b:true>,s:\"int64max\"=<x:9223372036854775807>,"
       "s:\"list\"=<av[<x:1>,<s:\"a\">]>,s:\"name\"=<s:\"x\">,s:\"nested\"=<a{sv}[s:\"n\"=<av[]>]>,s:\"ratio\"=<d:1.5>,s:\"small\"=<x:5>]>]",
       R"(ppid-1 en_US {"plan":"basic","seats":2})"},
      {"absent arguments are keys not sent", nullptr, metadata({}), "RequestMetadataForToken a{sv}[]", "ppid-1"},
      {"empty is not absent", nullptr, metadata({Data(), "", std::nullopt, Dictionary{}}),
       "RequestMetadataForToken a{sv}[s:\"token\"=<ay:>,s:\"uuid\"=<s:\"\">,s:\"requestInfo\"=<a{sv}[]>]", "ppid-1"},
      {"the deepest request info", nullptr, metadata({.requestInfo = nested(zlka_client::kMaxRequestInfoDepth)}),
       "RequestMetadataForToken a{sv}[s:\"requestInfo\"=<a{sv}[" + deepest + "]>]", "ppid-1"},
      {"activation", nullptr, activation({bytes({1, 2, 3}), "U-2"}),
       "RequestActivationForToken a{sv}[s:\"token\"=<ay:010203>,s:\"uuid\"=<s:\"U-2\">]", "deadbeef"},
      {"confirmation", nullptr, confirmation({std::nullopt, "U"}), "ConfirmActivationForToken a{sv}[s:\"uuid\"=<s:\"U\">]", "confirmed"},
      {"a raw call", nullptr, raw("RequestActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}u", 1, "token", "s", "x", 7u); }),
       "RequestActivationForToken a{sv}[s:\"token\"=<s:\"x\">] u:7", R"(["deadbeef"])"},
      // Refused before anything reaches the bus, where a malformed message could cost the connection.
      {"null", nullptr, metadata({.requestInfo = Dictionary{{"a", Array{Value(1), Value()}}}}), "", refused + "requestInfo.a[1] is null"},
      {"opaque value", nullptr, metadata({.requestInfo = Dictionary{{"d", Dictionary{{"fd", platform::Opaque{"file descriptor"}}}}}}), "",
       refused + "requestInfo.d.fd is a file descriptor, which cannot be sent"},
      {"string not UTF-8", nullptr, metadata({.requestInfo = Dictionary{{"s", "\xff"}}}), "", refused + "requestInfo.s is not a UTF-8 string"},
      {"key not UTF-8", nullptr, metadata({.requestInfo = Dictionary{{"k\xc0\x80", 1}}}), "", refused + "requestInfo has a key that is not"},
      {"uuid with NUL", nullptr, metadata({.uuid = std::string("a\0b", 3)}), "", refused + "uuid is not a UTF-8"},
      {"locale not UTF-8", nullptr, metadata({.requestedLocale = "en\xed\xa0\x80"}), "", refused + "requestedLocale is not a UTF-8"},
      {"activation uuid", nullptr, activation({std::nullopt, "\x80"}), "", refused + "uuid is not a UTF-8"},
      {"nested too deeply", nullptr, metadata({.requestInfo = nested(zlka_client::kMaxRequestInfoDepth + 1)}), "",
       refused + tooDeep + " is nested too deeply (more than 16 levels)"},
      {"raw writer refusal", nullptr, raw("ConfirmActivationForToken", [](sd_bus_message*) { return -EINVAL; }), "",
       "ZLKAClientErrorDomain 3: The call's arguments could not be encoded: Invalid argument."},
      // Answers of another form than the method promises.
      {"metadata not JSON", reply("sss", "p", "en_US", "{not json"), metadata({}), "RequestMetadataForToken a{sv}[]", malformed + "the metadata is not JSON"},
      {"metadata a JSON scalar", reply("sss", "p", "en_US", "\"x\""), metadata({}), "RequestMetadataForToken a{sv}[]", malformed + "the metadata is not JSON"},
      {"metadata a JSON array", reply("sss", "p", "de_DE", "[1,\"a\"]"), metadata({}), "RequestMetadataForToken a{sv}[]", R"(p de_DE [1,"a"])"},
      {"metadata short", reply("ss", "p", "en_US"), metadata({}), "RequestMetadataForToken a{sv}[]", malformed + "its signature is \"ss\" instead of \"sss\""},
      {"activation a string", reply("s", "t"), activation({}), "RequestActivationForToken a{sv}[]", malformed + "its signature is \"s\" instead of \"ay\""},
      {"confirmation not empty", reply("b", 1), confirmation({}), "ConfirmActivationForToken a{sv}[]", malformed + "its signature is \"b\" instead of \"\""},
      {"operation error", EchoService::error("com.kestro.ZLKAuthentication.Error.Network", "No network."), activation({}),
       "RequestActivationForToken a{sv}[]", "ZLKATokenManagerErrorDomain -5: No network."},
  };
  // clang-format on
  for (const auto& row : rows) {
    service->answerWith(row.answer ? row.answer : EchoService::canned);
    size_t before = service->calls().size();
    EXPECT_THAT(row.call(*client), HasSubstr(row.result)) << row.what;
    EXPECT_EQ(service->calls().size(), before + !row.sent.empty()) << row.what;
    if (!row.sent.empty()) {
      EXPECT_EQ(lastCall(), row.sent) << row.what;
    }
  }
}

TEST_F(ClientTest, CallsThatCanGetNoAnswerEndAsUnreachable) {
  const std::string noReply = "ZLKAClientErrorDomain 2: The service com.kestro.ZLKAuthentication.ZLKANetwork cannot be reached "
                              "(org.freedesktop.DBus.Error.NoReply";
  service->answerWith(EchoService::hold);
  auto impatient = connect(std::chrono::milliseconds(20));
  EXPECT_THAT(shown(impatient->confirmActivation({})), HasSubstr(noReply));
  Inbox timedOut, left, stranded;
  impatient->confirmActivationAsync({}, timedOut.callback<zlka_client::Confirmation>());
  EXPECT_THAT(timedOut.wait(1).at(0), HasSubstr(noReply));

  client->requestActivationAsync({}, left.callback<Data>());
  ASSERT_TRUE(service->waitForCalls(3));
  service.reset();  // leaves the bus without answering
  EXPECT_THAT(left.wait(1).at(0), HasSubstr(noReply));

  service = std::make_unique<EchoService>(bus->address());
  service->answerWith(EchoService::hold);
  client->requestActivationAsync({}, stranded.callback<Data>());
  ASSERT_TRUE(service->waitForCalls(1));
  bus.reset();  // the bus daemon goes away
  EXPECT_THAT(stranded.wait(1).at(0), HasSubstr("ZLKAClientErrorDomain 2: "));
  EXPECT_THAT(shown(client->confirmActivation({})), HasSubstr("ZLKAClientErrorDomain 2: The call could not be sent"));
}

TEST(ClientConnect, ABusThatCannotBeReachedFailsTheConnection) {
  PrivateBus empty;
  auto client = ZLKAClient::connect({.bus = empty.address()});
  ASSERT_TRUE(client.ok());  // the daemon is first looked for by a call
  EXPECT_THAT(shown(client.value()->confirmActivation({})), HasSubstr("(org.freedesktop.DBus.Error.ServiceUnknown"));
  auto missing = ZLKAClient::connect({.bus = "unix:path=/nonexistent/zlka"});
  EXPECT_EQ(missing.ok() ? "connected" : shown(missing.error()),
            "ZLKAClientErrorDomain 1: Cannot connect to the bus at \"unix:path=/nonexistent/zlka\": No such file or directory.");
  std::map<std::string, std::string> saved;  // the session bus is found through these
  for (const char* name : {"DBUS_SESSION_BUS_ADDRESS", "XDG_RUNTIME_DIR"})
    if (const char* value = std::getenv(name)) saved[name] = value, unsetenv(name);
  auto session = ZLKAClient::connect({.bus = "session"});
  EXPECT_EQ(session.ok() ? "connected" : shown(session.error()), "ZLKAClientErrorDomain 1: Cannot connect to the session bus: "
                                                                  "no session bus (DBUS_SESSION_BUS_ADDRESS and XDG_RUNTIME_DIR are unset).");
  for (const auto& [name, value] : saved) setenv(name.c_str(), value.c_str(), 1);
}

TEST_F(ClientTest, AsyncCallbacksRunOnceEachOnTheClientsOwnThread) {
  Inbox inbox;
  for (int i = 0; i < 20; ++i) {
    client->requestMetadataAsync({.uuid = "U" + std::to_string(i)}, inbox.callback<zlka_client::MetadataReply>());
    client->requestActivationAsync({}, inbox.callback<Data>());
    client->confirmActivationAsync({}, inbox.callback<zlka_client::Confirmation>());
  }
  client->requestMetadataAsync({.requestInfo = Dictionary{{"gone", Value()}}}, inbox.callback<zlka_client::MetadataReply>());
  std::vector<std::string> answers = inbox.wait(61);
  std::map<std::string, int> counts;
  for (const std::string& answer : answers) ++counts[answer.substr(0, 24)];
  EXPECT_EQ(counts, (std::map<std::string, int>{{"ppid-1 en_US {\"plan\":\"ba", 20}, {"deadbeef", 20}, {"confirmed", 20},
                                                 {"ZLKAClientErrorDomain 3:", 1}}));  // the last one refused, still called back
  EXPECT_EQ(answers.size(), 61u);
  EXPECT_EQ(inbox.threads().size(), 1u);
  EXPECT_FALSE(inbox.threads().count(std::this_thread::get_id()));
  EXPECT_EQ(service->calls().size(), 60u);
}

TEST_F(ClientTest, BlockingCallsAreAnsweredFromAnyThreadAndFromCallbacks) {
  std::atomic<int> answered{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t)
    threads.emplace_back([&] {
      for (int i = 0; i < 12; ++i) answered += shown(client->requestActivation({})) == "deadbeef";
    });
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(answered, 8 * 12);
  // The event thread itself waits here, so the inner answer cannot come through its own loop.
  Inbox inner;
  client->confirmActivationAsync({}, [&, callback = inner.callback<Data>()](auto) { callback(client->requestActivation({})); });
  EXPECT_EQ(inner.wait(1), std::vector<std::string>{"deadbeef"});
}

TEST_F(ClientTest, ClosingTheClientCancelsWhatIsUnanswered) {
  const std::string cancelled = "ZLKAClientErrorDomain 6: The client was closed before the service answered.";
  service->answerWith(EchoService::hold);
  Inbox held;
  for (int i = 0; i < 3; ++i) client->requestActivationAsync({}, held.callback<Data>());
  ASSERT_TRUE(service->waitForCalls(3));
  client.reset();  // returns once every callback has run
  EXPECT_EQ(held.wait(0), std::vector<std::string>(3, cancelled));

  // Destroyed by a callback, on its own event thread: it ends once that callback returns.
  client = connect();
  Inbox stranded, last;
  client->requestActivationAsync({}, stranded.callback<Data>());
  ASSERT_TRUE(service->waitForCalls(4));
  service->answerWith(EchoService::canned);
  client->confirmActivationAsync({}, [&, callback = last.callback<zlka_client::Confirmation>()](auto result) {
    client.reset();
    callback(std::move(result));
  });
  EXPECT_EQ(last.wait(1), std::vector<std::string>{"confirmed"});
  EXPECT_EQ(stranded.wait(1), std::vector<std::string>{cancelled});
}

}  // namespace
}  // namespace client_test
