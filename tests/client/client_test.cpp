// The client library and zlkactl against a stand-in for the daemon: how bus errors map back to
// domains and codes, what each kind of argument puts on the wire and what is refused before it, how
// answers are decoded, how calls end that can get no answer, on which thread and how often
// callbacks run, the installed interface's own types; and what zlkactl adds: required options,
// options turned into exactly the arguments given, answers and errors printed (as JSON with
// --json), one exit status per class of failure, and the settings suite.
#include "zlka/client.h"

#include <gmock/gmock.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <future>
#include <limits>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <sstream>
#include <thread>

#include "client/bus_names.h"
#include "client/zlka_client.h"
#include "common/child_process.h"
#include "platform/values/json.h"
#include "zlkactl/command_line.h"
#include "zlkactl/commands.h"
#include "zlkactl/token_input.h"

namespace client_test {
namespace {

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Error;
using platform::Value;
using testing::HasSubstr;
using zlka_client::ZLKAClient;
using zlkatest::PrivateBus;

std::string hex(const void* data, size_t length) {
  std::string out;
  for (const uint8_t* b = static_cast<const uint8_t*>(data); length-- > 0; ++b)
    out += {"0123456789abcdef"[*b >> 4], "0123456789abcdef"[*b & 15]};
  return out;
}

// The next complete value as wire text (see wireText), or "?" when it cannot be read.
std::string wireValue(sd_bus_message* m) {
  char type = 0;
  const char* contents = nullptr;
  const void* bytes = nullptr;
  size_t length = 0;
  if (sd_bus_message_peek_type(m, &type, &contents) <= 0) return "?";
  if (type == 'a' && std::strcmp(contents, "y") == 0)
    return sd_bus_message_read_array(m, 'y', &bytes, &length) < 0 ? "?" : "ay:" + hex(bytes, length);
  if (std::strchr("ave", type)) {
    if (sd_bus_message_enter_container(m, type, contents) <= 0) return "?";
    std::string inner;
    for (std::string item; sd_bus_message_at_end(m, 0) == 0 && (item = wireValue(m)) != "?";)
      inner += (inner.empty() ? "" : type == 'e' ? "=" : ",") + item;
    sd_bus_message_exit_container(m);
    return type == 'a' ? "a" + std::string(contents) + "[" + inner + "]" : type == 'v' ? "<" + inner + ">" : inner;
  }
  union {
    int b;
    int64_t x;
    uint64_t t;
    double d;
    const char* s;
  } v{};
  if (!std::strchr("bxtds", type) || sd_bus_message_read_basic(m, type, &v) <= 0) return "?";
  std::ostringstream text;
  text << type << ':';
  if (type == 'b')
    text << (v.b ? "true" : "false");
  else if (type == 'x')
    text << v.x;
  else if (type == 't')
    text << v.t;
  else if (type == 'd')
    text << v.d;
  else
    text << '"' << v.s << '"';
  return text.str();
}

// A call as "Member arguments" with every wire type shown, so that a test sees exactly what was
// sent: RequestActivationForToken a{sv}[s:"token"=<ay:0a0b>,s:"uuid"=<s:"U">]. Basic values are
// type:value, byte arrays ay:hex, arrays a<contents>[...], dictionary entries key=value, variants
// <...>; arguments are separated by a space.
std::string wireText(sd_bus_message* call) {
  std::string out = sd_bus_message_get_member(call);
  for (std::string item; sd_bus_message_at_end(call, 1) == 0 && (item = wireValue(call)) != "?";) out += " " + item;
  return out;
}

class EchoService {
 public:
  // Replies to one call; false leaves it unanswered for as long as the service lives.
  using Answer = std::function<bool(sd_bus_message* call)>;
  // Metadata ("ppid-1", "en_US", {"plan":"basic","seats":2}), activation de ad be ef, confirmation nothing.
  static bool canned(sd_bus_message* m) {
    std::string member = sd_bus_message_get_member(m);
    if (member == zlka_client::kMetadataMethod)
      return sd_bus_reply_method_return(m, "sss", "ppid-1", "en_US", R"({"plan":"basic","seats":2})") >= 0;
    if (member == zlka_client::kActivationMethod)
      return sd_bus_reply_method_return(m, "ay", 4, 0xde, 0xad, 0xbe, 0xef) >= 0;
    return sd_bus_reply_method_return(m, "") >= 0;
  }
  static bool hold(sd_bus_message*) { return false; }
  static Answer error(std::string name, std::string message) {
    return [=](sd_bus_message* m) { return sd_bus_reply_method_errorf(m, name.c_str(), "%s", message.c_str()) >= 0; };
  }

  // The name is owned once this returns.
  explicit EchoService(const std::string& address) {
    if (sd_bus_new(&bus_) < 0 || sd_bus_set_address(bus_, address.c_str()) < 0 || sd_bus_set_bus_client(bus_, 1) < 0 ||
        sd_bus_start(bus_) < 0 || sd_bus_request_name(bus_, zlka_client::kServiceName, 0) < 0 ||
        sd_bus_add_object(bus_, nullptr, zlka_client::kObjectPath, &EchoService::onMessage, this) < 0)
      ADD_FAILURE() << "the echo service cannot start";
    else  // polled, so that stopping needs no wake-up; a bus that goes away ends the loop too
      thread_ = std::thread([this] {
        for (int r = 0; !stop_ && r >= 0;)
          if ((r = sd_bus_process(bus_, nullptr)) == 0) r = sd_bus_wait(bus_, 20000);
      });
  }
  ~EchoService() {
    stop_ = true;
    if (thread_.joinable()) thread_.join();
    for (sd_bus_message* m : held_) sd_bus_message_unref(m);
    sd_bus_flush_close_unref(bus_);
  }
  bool ready() const { return thread_.joinable(); }
  void answerWith(Answer answer) {
    std::lock_guard lock(mutex_);
    answer_ = std::move(answer);
  }
  std::vector<std::string> calls() const {  // wireText of each, oldest first
    std::lock_guard lock(mutex_);
    return calls_;
  }
  bool waitForCalls(size_t count) const {  // false when they have not all come within a minute
    std::unique_lock lock(mutex_);
    return arrived_.wait_for(lock, std::chrono::minutes(1), [&] { return calls_.size() >= count; });
  }

 private:
  static int onMessage(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept {
    auto* self = static_cast<EchoService*>(userdata);
    if (sd_bus_message_is_method_call(m, nullptr, nullptr) <= 0) return 0;
    std::unique_lock lock(self->mutex_);
    self->calls_.push_back(wireText(m));
    Answer answer = self->answer_;
    lock.unlock();
    self->arrived_.notify_all();
    if (!answer(m)) self->held_.push_back(sd_bus_message_ref(m));
    return 1;
  }
  sd_bus* bus_ = nullptr;
  std::atomic<bool> stop_{false};
  std::thread thread_;
  mutable std::mutex mutex_;
  mutable std::condition_variable arrived_;
  Answer answer_ = canned;
  std::vector<std::string> calls_;
  std::vector<sd_bus_message*> held_;  // service thread only
};

// A result as text: the answer, or "domain code: description".
std::string shown(const platform::Error& e) {
  return e.domain() + " " + std::to_string(e.code()) + ": " + e.localizedDescription();
}
std::string shown(const zlka_client::MetadataReply& r) {
  return r.ppid + " " + r.locale + " " + *platform::json::serialize(r.metadata);
}
std::string shown(const platform::Data& data) { return hex(data.bytes(), data.length()); }
std::string shown(const zlka_client::Confirmation&) { return "confirmed"; }
std::string shown(const platform::Array& values) {
  platform::Array printable;  // bytes as hex: JSON has none
  for (const platform::Value& v : values) printable.push_back(v.data() ? platform::Value(shown(*v.data())) : v);
  return *platform::json::serialize(platform::Value(printable));
}
template <class T>
std::string shown(const zlka_client::Result<T>& result) {
  return result.ok() ? shown(result.value()) : shown(result.error());
}

// The results of asynchronous calls, shown, and the threads their callbacks ran on.
class Inbox {
 public:
  template <class T>
  std::function<void(zlka_client::Result<T>)> callback() {
    return [this](zlka_client::Result<T> result) {
      std::lock_guard lock(mutex_);
      results_.push_back(shown(result));
      threads_.insert(std::this_thread::get_id());
      arrived_.notify_all();
    };
  }
  std::vector<std::string> wait(size_t count) {  // once `count` have come, or after a minute
    std::unique_lock lock(mutex_);
    arrived_.wait_for(lock, std::chrono::minutes(1), [&] { return results_.size() >= count; });
    return results_;
  }
  std::set<std::thread::id> threads() {
    std::lock_guard lock(mutex_);
    return threads_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable arrived_;
  std::vector<std::string> results_;
  std::set<std::thread::id> threads_;
};

// A private bus with the echo service and a client connected to it.
class ClientTest : public testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(service->ready() && (client = connect())); }
  std::unique_ptr<zlka_client::ZLKAClient> connect(std::chrono::microseconds timeout = std::chrono::minutes(5)) {
    auto made = zlka_client::ZLKAClient::connect({.bus = bus->address(), .callTimeout = timeout});
    return made.ok() ? std::move(made).value() : nullptr;
  }
  // The calls the service received since this was last asked, one a line.
  std::string newCalls() {
    std::string out;
    for (const auto& calls = service->calls(); seen < calls.size(); ++seen)
      out += (out.empty() ? "" : "\n") + calls[seen];
    return out;
  }

  std::unique_ptr<PrivateBus> bus = std::make_unique<PrivateBus>();
  std::unique_ptr<EchoService> service = std::make_unique<EchoService>(bus->address());
  std::unique_ptr<zlka_client::ZLKAClient> client;
  size_t seen = 0;
};

constexpr char kOperation[] = "ZLKATokenManagerErrorDomain";
constexpr char kClient[] = "ZLKAClientErrorDomain";

// Request info nested `levels` dictionaries deep, the innermost {"leaf": true}.
Dictionary nested(int levels) {
  Dictionary d{{"leaf", true}};
  while (--levels > 0) d = Dictionary{{"in", d}};
  return d;
}

TEST(ClientErrors, BusErrorsMapBackToDomainAndCode) {
  const std::string op = "com.kestro.ZLKAuthentication.Error.", bus = "org.freedesktop.DBus.Error.";
  const char* const operationErrors[] = {"Unknown", "MissingEntitlement", "InvalidParameter", "Internal", "Network",
                                         "Server"};
  for (int64_t code = -1; code >= -6; --code)  // exactly the daemon's error, nothing added
    EXPECT_EQ(zlka_client::errorFromBusError(op + operationErrors[-code - 1], "m"),
              Error(kOperation, code, Dictionary{{platform::LocalizedDescriptionKey, "m"}}));
  EXPECT_EQ(zlka_client::errorFromBusError(op + "Server", ""),
            Error(kOperation, -6));  // the description is the error's own
  // Any other name stays in the client domain with its name and message: a refusal (4) or, where
  // nothing answered, the service unreachable (2).
  // clang-format off
  const std::pair<std::string, int64_t> otherErrors[] = {
      {op + "Bogus", 4}, {op, 4}, {bus + "InvalidArgs", 4}, {bus + "AccessDenied", 4}, {bus + "ServiceUnknown", 2},
      {bus + "NameHasNoOwner", 2}, {bus + "NoReply", 2}, {bus + "Timeout", 2}, {bus + "TimedOut", 2},
      {bus + "Disconnected", 2}, {bus + "NoServer", 2}, {bus + "NoNetwork", 2}, {bus + "Spawn.ExecFailed", 2}};
  // clang-format on
  for (const auto& [name, code] : otherErrors) {
    Error e = zlka_client::errorFromBusError(name, "m");
    EXPECT_THAT(shown(e),
                testing::AllOf(testing::StartsWith(kClient + (" " + std::to_string(code))), HasSubstr(name + ": m")))
        << name;
    EXPECT_EQ(*e.userInfo()->at(zlka_client::kBusErrorNameKey).string() + " " +
                  *e.userInfo()->at(zlka_client::kBusErrorMessageKey).string(),
              name + " m");
  }
  // Failures to send: arguments that cannot be encoded (3), or no one to send them to (2).
  for (int e : {EINVAL, EBADMSG, E2BIG, EMSGSIZE}) EXPECT_EQ(zlka_client::errorFromSendFailure(-e).code(), 3) << e;
  for (int e : {ENOTCONN, ECONNRESET}) EXPECT_EQ(zlka_client::errorFromSendFailure(-e).code(), 2) << e;
}

TEST(ClientErrors, BusStringsAreWellFormedUTF8WithoutNUL) {
  // Each boundary of the encoding: 1-, 2-, 3- and 4-byte forms, around the surrogates, U+10FFFF.
  for (const char* good : {"", "\x7f", "\xc2\x80", "\xdf\xbf", "\xe0\xa0\x80", "\xed\x9f\xbf", "\xee\x80\x80",
                           "\xef\xbf\xbf", "\xf0\x90\x80\x80", "\xf1\x80\x80\x80", "\xf4\x8f\xbf\xbf", "caf\xc3\xa9"})
    EXPECT_TRUE(zlka_client::isBusString(good)) << testing::PrintToString(std::string(good));
  using namespace std::string_literals;
  for (const std::string& bad :
       {"a\0b"s, "\xc0\x80"s, "\xc1\xbf"s, "\xe0\x9f\xbf"s, "\xf0\x8f\xbf\xbf"s,     // NUL, overlong
        "\xed\xa0\x80"s, "\xed\xbf\xbf"s, "\xf4\x90\x80\x80"s, "\xf5\x80\x80\x80"s,  // surrogates, past U+10FFFF
        "\xc3"s, "\xf0\x9f\x98"s, "\xc3\x28"s, "\x80"s, "\xff"s})                    // cut short, no lead byte
    EXPECT_FALSE(zlka_client::isBusString(bad)) << testing::PrintToString(bad);
}

TEST_F(ClientTest, CallsSendExactlyTheirArgumentsAndDecodeTheAnswer) {
  const uint64_t int64Max = std::numeric_limits<int64_t>::max();
  // clang-format off
  const Dictionary info{{"flag", true}, {"name", "x"}, {"count", int64_t{-3}}, {"small", uint64_t{5}}, {"int64max", int64Max},
                        {"above", int64Max + 1}, {"ratio", 1.5}, {"blob", Data::fromString("\x01\x02")},
                        {"list", Array{Value(1), Value("a")}}, {"nested", Dictionary{{"n", Array{}}}}};
  // clang-format on
  std::string deepest = "s:\"leaf\"=<b:true>", tooDeep = "requestInfo";
  for (int i = 0; i < zlka_client::kMaxRequestInfoDepth; ++i) tooDeep += ".in";
  for (int i = 1; i < zlka_client::kMaxRequestInfoDepth; ++i) deepest = "s:\"in\"=<a{sv}[" + deepest + "]>";
  auto metadata = [](zlka_client::MetadataArguments a) {
    return [a](ZLKAClient& c) { return shown(c.requestMetadata(a)); };
  };
  auto activation = [](zlka_client::TokenArguments a) {
    return [a](ZLKAClient& c) { return shown(c.requestActivation(a)); };
  };
  auto confirmation = [](zlka_client::TokenArguments a) {
    return [a](ZLKAClient& c) { return shown(c.confirmActivation(a)); };
  };
  auto raw = [](const char* method, ZLKAClient::ArgumentWriter w) {
    return [=](ZLKAClient& c) { return shown(c.callRaw(method, w)); };
  };
  auto reply = [](auto... arguments) {
    return [=](sd_bus_message* m) { return sd_bus_reply_method_return(m, arguments...) >= 0; };
  };
  const std::string refused = "ZLKAClientErrorDomain 3: Cannot send the call: ",
                    malformed = "ZLKAClientErrorDomain 5: The service's answer is malformed: ";
  // clang-format off
  const struct { const char* what; EchoService::Answer answer; std::function<std::string(ZLKAClient&)> call; std::string sent, result; } rows[] = {
      {"every kind of argument", nullptr, metadata({Data::fromString("\x0a\xff"), "U-1", "en_US", info}),
       "RequestMetadataForToken a{sv}[s:\"token\"=<ay:0aff>,s:\"uuid\"=<s:\"U-1\">,s:\"requestedLocale\"=<s:\"en_US\">,s:\"requestInfo\"=<a{sv}["
       "s:\"above\"=<t:9223372036854775808>,s:\"blob\"=<ay:0102>,s:\"count\"=<x:-3>,s:\"flag\"=<b:true>,s:\"int64max\"=<x:9223372036854775807>,"
       "s:\"list\"=<av[<x:1>,<s:\"a\">]>,s:\"name\"=<s:\"x\">,s:\"nested\"=<a{sv}[s:\"n\"=<av[]>]>,s:\"ratio\"=<d:1.5>,s:\"small\"=<x:5>]>]",
       R"(ppid-1 en_US {"plan":"basic","seats":2})"},
      {"absent arguments are keys not sent", nullptr, metadata({}), "RequestMetadataForToken a{sv}[]", "ppid-1"},
      {"empty is not absent", nullptr, metadata({Data(), "", std::nullopt, Dictionary{}}),
       "RequestMetadataForToken a{sv}[s:\"token\"=<ay:>,s:\"uuid\"=<s:\"\">,s:\"requestInfo\"=<a{sv}[]>]", "ppid-1"},
      {"the deepest request info", nullptr, metadata({.requestInfo = nested(zlka_client::kMaxRequestInfoDepth)}),
       "RequestMetadataForToken a{sv}[s:\"requestInfo\"=<a{sv}[" + deepest + "]>]", "ppid-1"},
      {"activation", nullptr, activation({Data::fromString("\x01\x02\x03"), "U-2"}),
       "RequestActivationForToken a{sv}[s:\"token\"=<ay:010203>,s:\"uuid\"=<s:\"U-2\">]", "deadbeef"},
      {"confirmation", nullptr, confirmation({std::nullopt, "U"}), "ConfirmActivationForToken a{sv}[s:\"uuid\"=<s:\"U\">]", "confirmed"},
      {"a raw call", nullptr, raw("RequestActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}b", 1, "token", "s", "x", 1); }),
       "RequestActivationForToken a{sv}[s:\"token\"=<s:\"x\">] b:true", R"(["deadbeef"])"},
      // Refused before anything reaches the bus, where a malformed message could cost the connection.
      {"null", nullptr, metadata({.requestInfo = Dictionary{{"a", Array{Value(1), Value()}}}}), "", refused + "requestInfo.a[1] is null"},
      {"opaque value", nullptr, metadata({.requestInfo = Dictionary{{"d", Dictionary{{"fd", platform::Opaque{"file descriptor"}}}}}}), "",
       refused + "requestInfo.d.fd is a file descriptor, which cannot be sent"},
      {"string not UTF-8", nullptr, metadata({.requestInfo = Dictionary{{"s", "\xff"}}}), "", refused + "requestInfo.s is not a UTF-8 string"},
      {"key not UTF-8", nullptr, metadata({.requestInfo = Dictionary{{"k\xc0\x80", 1}}}), "", refused + "requestInfo has a key that is not"},
      {"uuid with NUL", nullptr, metadata({.uuid = std::string("a\0b", 3)}), "", refused + "uuid is not a UTF-8"},
      {"locale not UTF-8", nullptr, metadata({.requestedLocale = "en\xed\xa0\x80"}), "", refused + "requestedLocale is not a UTF-8"},
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
    EXPECT_THAT(row.call(*client), HasSubstr(row.result)) << row.what;
    EXPECT_EQ(newCalls(), row.sent) << row.what;
  }
}

TEST_F(ClientTest, CallsThatCanGetNoAnswerEndAsUnreachable) {
  const std::string noReply =
      "ZLKAClientErrorDomain 2: The service com.kestro.ZLKAuthentication.ZLKANetwork cannot be reached "
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

// A bus address that cannot be reached is zlkactl's table's; a bus without the daemon, the
// installed library's test.
TEST(ClientConnect, NoSessionBusFailsTheConnection) {
  std::map<std::string, std::string> saved;  // the session bus is found through these
  for (const char* name : {"DBUS_SESSION_BUS_ADDRESS", "XDG_RUNTIME_DIR"})
    if (const char* value = std::getenv(name)) saved[name] = value, unsetenv(name);
  auto session = ZLKAClient::connect({.bus = "session"});
  EXPECT_EQ(session.ok() ? "connected" : shown(session.error()),
            "ZLKAClientErrorDomain 1: Cannot connect to the session bus: "
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
  client->requestMetadataAsync({.requestInfo = Dictionary{{"gone", Value()}}},
                               inbox.callback<zlka_client::MetadataReply>());
  std::vector<std::string> answers = inbox.wait(61);
  std::map<std::string, int> counts;
  for (const std::string& answer : answers) ++counts[answer.substr(0, 24)];
  EXPECT_EQ(counts,
            (std::map<std::string, int>{{"ppid-1 en_US {\"plan\":\"ba", 20},
                                        {"deadbeef", 20},
                                        {"confirmed", 20},
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
  client->confirmActivationAsync(
      {}, [&, callback = inner.callback<Data>()](auto) { callback(client->requestActivation({})); });
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

// The installed interface: its own types in and out, and a refusal answered on the client's
// thread like any answer. Its blocking calls are what zlkactl's table goes through.
TEST_F(ClientTest, ThePublicInterfaceSpeaksOnlyItsOwnTypes) {
  auto made = zlka::Client::connect({.bus = bus->address()});
  ASSERT_TRUE(made.ok());
  zlka::Client& c = *made.value();
  auto text = [](const zlka::Error& e) {
    return e.domain + " " + std::to_string(e.code) + " " + e.busErrorName + ": " + e.description;
  };
  std::promise<std::string> refused, activated;
  std::thread::id refusedOn;
  c.requestMetadataAsync({.requestInfoJSON = "[1]"}, [&](zlka::Result<zlka::Metadata> r) {
    refusedOn = std::this_thread::get_id();
    refused.set_value(r ? "answered" : text(r.error()));
  });
  c.requestActivationAsync({.token = zlka::Bytes{1}}, [&](zlka::Result<zlka::Bytes> r) {
    activated.set_value(r ? hex(r.value().data(), r.value().size()) : text(r.error()));
  });
  EXPECT_EQ(refused.get_future().get(),
            "ZLKAClientErrorDomain 3 : Cannot send the call: requestInfo is an array, not a JSON object.");
  EXPECT_NE(refusedOn, std::this_thread::get_id());
  EXPECT_EQ(activated.get_future().get(), "deadbeef");
  service->answerWith(EchoService::error("org.freedesktop.DBus.Error.AccessDenied", "No."));
  auto denied = c.confirmActivation({});
  EXPECT_EQ(denied ? "confirmed" : text(denied.error()),
            "ZLKAClientErrorDomain 4 org.freedesktop.DBus.Error.AccessDenied: The call was refused with "
            "org.freedesktop.DBus.Error.AccessDenied: No.");
  EXPECT_EQ(newCalls(), "RequestActivationForToken a{sv}[s:\"token\"=<ay:01>]\nConfirmActivationForToken a{sv}[]");
}

// Parses and runs, as main() does.
zlkatest::RunResult zlkactl(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), "zlkactl");
  std::vector<const char*> argv;
  for (const auto& a : arguments) argv.push_back(a.c_str());
  std::ostringstream out, err;
  auto parsed = zlkactl::parseCommandLine(static_cast<int>(argv.size()), argv.data(), out, err);
  int status = parsed.invocation ? zlkactl::run(*parsed.invocation, out, err) : parsed.exitStatus;
  return {status, out.str(), err.str()};
}

TEST_F(ClientTest, ZlkactlSendsWhatItIsGivenAndExitsByTheKindOfFailure) {
  zlkatest::TempDir dir;
  const std::string token = (dir.path() / "token").string(), large = (dir.path() / "large").string(),
                    b = bus->address();
  std::ofstream(token) << std::string("\x00\x01\xff", 3);
  std::ofstream(large) << std::string(zlkactl::kMaxTokenFileSize + 1, 'x');
  const std::string confirmed = R"(ConfirmActivationForToken a{sv}[s:"token"=<ay:01>,s:"uuid"=<s:"U">])";
  // Usage errors (2) and unreachable services (3) send nothing; the rest sends `sent`.
  // clang-format off
  const struct { std::vector<std::string> arguments; EchoService::Answer answer; int status; std::string out, err, sent; } rows[] = {
      {{"--bus", b, "--json", "metadata", "--token-hex", "0a0B", "--uuid", "U", "--locale", "en_US", "--request-info", R"({"s":"setup","n":7})"}, nullptr, 0,
       R"({"locale":"en_US","metadata":{"plan":"basic","seats":2},"ppid":"ppid-1"})" "\n", "",
       R"(RequestMetadataForToken a{sv}[s:"token"=<ay:0a0b>,s:"uuid"=<s:"U">,s:"requestedLocale"=<s:"en_US">,s:"requestInfo"=<a{sv}[s:"n"=<x:7>,s:"s"=<s:"setup">]>])"},
      {{"metadata", "--uuid", "U", "--token-hex", "01", "--locale", "en_US", "--bus", b}, nullptr, 0,
       "ppid: ppid-1\nlocale: en_US\nmetadata:\n{\n  \"plan\": \"basic\",\n  \"seats\": 2\n}\n", "",
       R"(RequestMetadataForToken a{sv}[s:"token"=<ay:01>,s:"uuid"=<s:"U">,s:"requestedLocale"=<s:"en_US">])"},
      {{"--bus", b, "activate", "--token-base64", "AQI=", "--uuid", "U-9"}, nullptr, 0, "token: deadbeef\nlength: 4 bytes\n", "",
       R"(RequestActivationForToken a{sv}[s:"token"=<ay:0102>,s:"uuid"=<s:"U-9">])"},
      {{"--bus", b, "--json", "activate", "--token-file", token, "--uuid", "U"}, nullptr, 0,
       R"({"length":4,"token_base64":"3q2+7w==","token_hex":"deadbeef"})" "\n", "", R"(RequestActivationForToken a{sv}[s:"token"=<ay:0001ff>,s:"uuid"=<s:"U">])"},
      {{"--bus", b, "confirm", "--token-hex", "01", "--uuid", "U"}, nullptr, 0, "confirmed\n", "", confirmed},
      {{"--bus", b, "--json", "confirm", "--token-hex", "01", "--uuid", "U"}, nullptr, 0, "{\"confirmed\":true}\n", "", confirmed},
      {{"--bus", b, "confirm", "--token-hex", "01", "--uuid", "U"}, EchoService::error("com.kestro.ZLKAuthentication.Error.Network", "Gone."), 1, "",
       "zlkactl: ZLKATokenManagerErrorDomain -5: Gone.\n", confirmed},
      {{"--bus", "unix:path=/nonexistent/zlka", "confirm", "--token-hex", "01", "--uuid", "U"}, nullptr, 3, "",
       "zlkactl: ZLKAClientErrorDomain 1: Cannot connect to the bus at \"unix:path=/nonexistent/zlka\": No such file or directory.\n", ""},
      {{"--bus", b, "--timeout", "0.05", "confirm", "--token-hex", "01", "--uuid", "U"}, EchoService::hold, 3, "",
       "zlkactl: ZLKAClientErrorDomain 2: The service com.kestro.ZLKAuthentication.ZLKANetwork cannot be reached (org.freedesktop.DBus.Error.NoReply",
       confirmed},
      // Under --json every error is one JSON object on standard error, with the same exit status.
      {{"--bus", b, "--json", "confirm", "--token-hex", "01", "--uuid", "U"}, EchoService::error("com.kestro.ZLKAuthentication.Error.Network", "Gone."), 1,
       "", R"({"code":-5,"description":"Gone.","domain":"ZLKATokenManagerErrorDomain"})" "\n", confirmed},
      {{"--bus", b, "--json", "confirm", "--token-hex", "01"}, nullptr, 2, "", R"({"code":2,"description":"--uuid is required","domain":"zlkactl"})" "\n", ""},
      // What the daemon needs is required before anything is sent.
      {{"--bus", b, "activate", "--uuid", "U"}, nullptr, 2, "", "zlkactl: A token (--token-file, --token-hex or --token-base64) is required\n", ""},
      {{"--bus", b, "confirm", "--token-hex", "01"}, nullptr, 2, "", "zlkactl: --uuid is required\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "01", "--uuid", "U"}, nullptr, 2, "", "zlkactl: --locale is required\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "abc", "--uuid", "U", "--locale", "en_US"}, nullptr, 2, "", "zlkactl: --token-hex: an odd number of hex digits\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "0g", "--uuid", "U", "--locale", "en_US"}, nullptr, 2, "", "zlkactl: --token-hex: character 2 is not a hex digit\n", ""},
      {{"--bus", b, "confirm", "--token-base64", "AQI", "--uuid", "U"}, nullptr, 2, "", "zlkactl: --token-base64: not valid base64", ""},
      {{"--bus", b, "activate", "--token-file", "/nonexistent/t", "--uuid", "U"}, nullptr, 2, "", "zlkactl: --token-file: cannot read /nonexistent/t: No such file", ""},
      {{"--bus", b, "activate", "--token-file", large, "--uuid", "U"}, nullptr, 2, "", "zlkactl: --token-file: " + large + " is larger than 1048576 bytes\n", ""},
      {{"--bus", b, "activate", "--token-hex", "01", "--uuid", "\xff"}, nullptr, 2, "", "zlkactl: --uuid: not UTF-8 text\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "01", "--uuid", "U", "--locale", "en_US", "--request-info", "[1]"}, nullptr, 2, "",
       "zlkactl: --request-info: must be a JSON object, not an array\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "01", "--uuid", "U", "--locale", "en_US", "--request-info", "{\"a\":"}, nullptr, 2, "",
       "zlkactl: --request-info: not valid JSON", ""},
      {{"--bus", b, "metadata", "--token-hex", "00", "--token-base64", "AA=="}, nullptr, 2, "", "zlkactl: ", ""},  // one token source
      {{"--bus", b, "activate", "--locale", "en_US"}, nullptr, 2, "", "zlkactl: ", ""},  // metadata only
      {{"--bus", "nowhere", "confirm"}, nullptr, 2, "", "zlkactl: ", ""},
      {{"--bus", b}, nullptr, 2, "", "zlkactl: ", ""},
      {{"--bus", b, "--timeout", "0", "confirm", "--token-hex", "01", "--uuid", "U"}, nullptr, 2, "", "zlkactl: --timeout: ", ""},
      {{"--version"}, nullptr, 0, "zlkactl " ZLKA_VERSION "\n", "", ""},
  };
  // clang-format on
  for (const auto& row : rows) {
    service->answerWith(row.answer ? row.answer : EchoService::canned);
    zlkatest::RunResult run = zlkactl(row.arguments);
    const std::string arguments = testing::PrintToString(row.arguments);
    EXPECT_EQ(run.status, row.status) << arguments << run.err;
    EXPECT_EQ(run.out, row.out) << arguments;
    EXPECT_THAT(run.err, testing::StartsWith(row.err)) << arguments;
    EXPECT_EQ(newCalls(), row.sent) << arguments;
  }
  // The other failures of a call: unreachable (3), input that cannot be sent (2), the rest (1).
  using zlka_client::ClientErrorCode;
  for (const auto& [code, status] : {std::pair{ClientErrorCode::ServiceUnavailable, 3},
                                     {ClientErrorCode::InvalidRequest, 2},
                                     {ClientErrorCode::Refused, 1},
                                     {ClientErrorCode::MalformedReply, 1},
                                     {ClientErrorCode::Cancelled, 1}})
    EXPECT_EQ(zlkactl::exitStatusFor({zlka::kClientErrorDomain, static_cast<int64_t>(code), "", ""}), status)
        << static_cast<int>(code);
}

TEST(Zlkactl, DefaultsKeepJSONValuesAndPlainStrings) {
  zlkatest::TempDir temporary;
  const std::filesystem::path dir = temporary.path(), config = dir / "zlkad.toml";
  std::ofstream(config) << "[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n"
                           "[servers.prod]\nstatic_content = \"https://127.0.0.1:1\"\napi = \"https://127.0.0.1:1\"\n"
                           "[sap]\ntrust_anchor = \"/x.pem\"\n[settings]\nsuite_dir = \""
                        << dir.string() << "\"\n";
  const std::string suite = (dir / "com.kestro.ZLKAuthentication.json").string();
  const struct {
    std::vector<std::string> arguments;
    int status;
    std::string out, err;
  } rows[] = {
      {{"write", "--force", "Plan", R"({"a":[1]})"}, 0, "", ""},
      {{"write", "--force", "Pair", "1,2"}, 0, "", ""},  // not one JSON value
      {{"read", "Plan"}, 0, "{\n  \"a\": [\n    1\n  ]\n}\n", ""},
      {{"delete", "Plan"}, 0, "", ""},
      {{"read"}, 0, "{\n  \"Pair\": \"1,2\"\n}\n", ""},
      {{"read", "Plan"}, 1, "", "zlkactl: com.kestro.ZLKAuthentication has no value for 'Plan' (" + suite + ")\n"},
      // Only keys the daemon reads, unless forced: a misspelt one would be ignored silently.
      {{"write", "ForceNetworkFailur", "true"},
       2,
       "",
       "zlkactl: zlkad reads no setting 'ForceNetworkFailur' (it reads Server, CustomServer, "
       "StaticContentServer, TarvexSAPServer, ForceNetworkFailure, ForceTokenActivationFailure, "
       "ForceTokenConfirmationFailure, "
       "ForceTarvexSAPFailure); --force writes it anyway\n"},
      {{"write", "ForceNetworkFailure", "true"}, 0, "", ""},
      {{"read", "ForceNetworkFailure"}, 0, "true\n", ""},
  };
  for (const auto& row : rows) {
    std::vector<std::string> arguments = {"--config", config.string(), "defaults"};
    arguments.insert(arguments.end(), row.arguments.begin(), row.arguments.end());
    zlkatest::RunResult run = zlkactl(arguments);
    EXPECT_EQ(run.status, row.status) << row.arguments[0] << run.err;
    EXPECT_EQ(run.out, row.out) << row.arguments[0];
    EXPECT_EQ(run.err, row.err) << row.arguments[0];
  }
  zlkatest::RunResult unusable = zlkactl({"--config", (dir / "absent.toml").string(), "defaults", "read"});
  EXPECT_EQ(unusable.status, 2);
  EXPECT_THAT(unusable.err, testing::HasSubstr("absent.toml"));
}

}  // namespace
}  // namespace client_test
