// How failures come back: the daemon's operation errors as the very errors it made, every other
// D-Bus error in the client domain with its name, and the failures that mean "unreachable".
#include "client_fixture.h"
#include "zlkactl/commands.h"

namespace client_test {
namespace {

using platform::Dictionary;
using platform::Error;
using platform::Value;
using zlka_client::ClientErrorCode;
using zlka_client::errorFromBusError;
using zlka_client::kClientErrorDomain;

int64_t code(ClientErrorCode c) { return static_cast<int64_t>(c); }

Error described(const char* domain, int64_t code, std::string message) {
  return Error(domain, code, Dictionary{{platform::LocalizedDescriptionKey, std::move(message)}});
}

const std::string* userInfoString(const Error& error, const char* key) {
  if (!error.userInfo()) return nullptr;
  auto it = error.userInfo()->find(key);
  return it == error.userInfo()->end() ? nullptr : it->second.string();
}

struct OperationError {
  const char* name;
  int64_t code;
  const char* message;
};
const OperationError kOperationErrors[] = {
    {"Unknown", -1, "An unknown error has occurred."},
    {"MissingEntitlement", -2, "Framework client is missing entitlement."},
    {"InvalidParameter", -3, "An invalid parameter was provided by the caller."},
    {"Internal", -4, "An internal error has occurred."},
    {"Network", -5, "There was a problem connecting to the network."},
    {"Server", -6, "An internal server error has occurred."},
};

TEST(ErrorMappingTest, OperationErrorNamesMapBackToDomainAndCode) {
  for (const OperationError& e : kOperationErrors) {
    Error mapped = errorFromBusError(std::string("com.kestro.ZLKAuthentication.Error.") + e.name, e.message);
    EXPECT_EQ(mapped, described("ZLKATokenManagerErrorDomain", e.code, e.message)) << e.name;
    EXPECT_FALSE(zlka_client::isServiceUnreachable(mapped));
    EXPECT_EQ(zlkactl::exitStatusFor(mapped), zlkactl::kExitOperationFailed);
  }
  // An empty message leaves the description to the error itself.
  EXPECT_EQ(errorFromBusError("com.kestro.ZLKAuthentication.Error.Server", ""), Error("ZLKATokenManagerErrorDomain", -6));
}

TEST(ErrorMappingTest, OtherBusErrorsKeepTheirNameInTheClientDomain) {
  struct Case {
    const char* name;
    ClientErrorCode code;
    int exitStatus;
  } cases[] = {
      {"org.freedesktop.DBus.Error.InvalidArgs", ClientErrorCode::Refused, zlkactl::kExitOperationFailed},
      {"org.freedesktop.DBus.Error.AccessDenied", ClientErrorCode::Refused, zlkactl::kExitOperationFailed},
      {"org.freedesktop.DBus.Error.UnknownMethod", ClientErrorCode::Refused, zlkactl::kExitOperationFailed},
      {"com.kestro.ZLKAuthentication.Error.Bogus", ClientErrorCode::Refused, zlkactl::kExitOperationFailed},
      {"com.kestro.ZLKAuthentication.Error.", ClientErrorCode::Refused, zlkactl::kExitOperationFailed},
      {"org.freedesktop.DBus.Error.ServiceUnknown", ClientErrorCode::ServiceUnavailable, zlkactl::kExitUnreachable},
      {"org.freedesktop.DBus.Error.NameHasNoOwner", ClientErrorCode::ServiceUnavailable, zlkactl::kExitUnreachable},
      {"org.freedesktop.DBus.Error.NoReply", ClientErrorCode::ServiceUnavailable, zlkactl::kExitUnreachable},
      {"org.freedesktop.DBus.Error.NoServer", ClientErrorCode::ServiceUnavailable, zlkactl::kExitUnreachable},
      {"org.freedesktop.DBus.Error.Spawn.ExecFailed", ClientErrorCode::ServiceUnavailable, zlkactl::kExitUnreachable},
  };
  for (const Case& c : cases) {
    Error mapped = errorFromBusError(c.name, "the message");
    EXPECT_EQ(mapped.domain(), kClientErrorDomain) << c.name;
    EXPECT_EQ(mapped.code(), code(c.code)) << c.name;
    ASSERT_NE(userInfoString(mapped, zlka_client::kBusErrorNameKey), nullptr);
    EXPECT_EQ(*userInfoString(mapped, zlka_client::kBusErrorNameKey), c.name);
    EXPECT_EQ(*userInfoString(mapped, zlka_client::kBusErrorMessageKey), "the message");
    EXPECT_NE(mapped.localizedDescription().find(std::string(c.name) + ": the message"), std::string::npos) << mapped.localizedDescription();
    EXPECT_EQ(zlkactl::exitStatusFor(mapped), c.exitStatus) << c.name;
  }
}

TEST_F(ClientBusTest, OperationErrorsFromTheServiceArriveAsTheDaemonMadeThem) {
  for (const OperationError& e : kOperationErrors) {
    service->answerWith(EchoService::error(std::string("com.kestro.ZLKAuthentication.Error.") + e.name, e.message));
    Error expected = described("ZLKATokenManagerErrorDomain", e.code, e.message);
    auto metadata = client->requestMetadata({});
    ASSERT_FALSE(metadata.ok());
    EXPECT_EQ(metadata.error(), expected);
    auto activation = client->requestActivation({});
    ASSERT_FALSE(activation.ok());
    EXPECT_EQ(activation.error(), expected);
    Answers<zlka_client::Confirmation> confirmation(1);
    client->confirmActivationAsync({}, confirmation.callback());
    confirmation.wait();
    ASSERT_FALSE(confirmation.results()[0].ok());
    EXPECT_EQ(confirmation.results()[0].error(), expected);
  }
}

TEST_F(ClientBusTest, TransportErrorsFromTheServiceAreClientErrors) {
  service->answerWith(EchoService::error("org.freedesktop.DBus.Error.InvalidArgs", "Key 'token' must hold a value of type ay."));
  auto answer = client->requestActivation({});
  ASSERT_FALSE(answer.ok());
  EXPECT_EQ(answer.error().domain(), kClientErrorDomain);
  EXPECT_EQ(answer.error().code(), code(ClientErrorCode::Refused));
  EXPECT_EQ(*userInfoString(answer.error(), zlka_client::kBusErrorNameKey), "org.freedesktop.DBus.Error.InvalidArgs");
  EXPECT_EQ(answer.error().localizedDescription(),
            "The call was refused with org.freedesktop.DBus.Error.InvalidArgs: Key 'token' must hold a value of type ay.");
}

TEST(ClientWithoutServiceTest, AMissingServiceIsUnreachable) {
  PrivateBus empty;
  ASSERT_TRUE(empty.running());
  auto client = zlka_client::ZLKAClient::connect({.bus = empty.address()});
  ASSERT_TRUE(client.ok()) << client.error().description();
  auto answer = client.value()->requestMetadata({});
  ASSERT_FALSE(answer.ok());
  EXPECT_EQ(answer.error().code(), code(ClientErrorCode::ServiceUnavailable));
  EXPECT_EQ(*userInfoString(answer.error(), zlka_client::kBusErrorNameKey), "org.freedesktop.DBus.Error.ServiceUnknown");
  EXPECT_TRUE(zlka_client::isServiceUnreachable(answer.error()));
}

TEST_F(ClientBusTest, ServiceLeavingWithoutAnsweringIsUnreachable) {
  service->answerWith(EchoService::hold());
  Answers<platform::Data> answers(1);
  client->requestActivationAsync({}, answers.callback());
  service->waitForCalls(1);
  service.reset();
  answers.wait();
  ASSERT_FALSE(answers.results()[0].ok());
  EXPECT_EQ(answers.results()[0].error().code(), code(ClientErrorCode::ServiceUnavailable));
  EXPECT_EQ(*userInfoString(answers.results()[0].error(), zlka_client::kBusErrorNameKey), "org.freedesktop.DBus.Error.NoReply");
}

TEST_F(ClientBusTest, ABusThatGoesAwayFailsCallsInsteadOfHangingThem) {
  service->answerWith(EchoService::hold());
  Answers<platform::Data> pending(1);
  client->requestActivationAsync({}, pending.callback());
  service->waitForCalls(1);
  bus.reset();  // the bus daemon is killed
  pending.wait();
  ASSERT_FALSE(pending.results()[0].ok());
  EXPECT_EQ(pending.results()[0].error().code(), code(ClientErrorCode::ServiceUnavailable));
  auto later = client->confirmActivation({});
  ASSERT_FALSE(later.ok());
  EXPECT_EQ(later.error().code(), code(ClientErrorCode::ServiceUnavailable));
  EXPECT_TRUE(zlka_client::isServiceUnreachable(later.error()));
}

TEST_F(ClientBusTest, CallsTimeOutAsNoReply) {
  service->answerWith(EchoService::hold());
  auto impatient = connect(std::chrono::milliseconds(20));
  ASSERT_NE(impatient, nullptr);
  auto answer = impatient->confirmActivation({});
  ASSERT_FALSE(answer.ok());
  EXPECT_EQ(answer.error().code(), code(ClientErrorCode::ServiceUnavailable));
  EXPECT_EQ(*userInfoString(answer.error(), zlka_client::kBusErrorNameKey), "org.freedesktop.DBus.Error.NoReply");

  Answers<zlka_client::Confirmation> async(1);
  impatient->confirmActivationAsync({}, async.callback());
  async.wait();
  ASSERT_FALSE(async.results()[0].ok());
  EXPECT_EQ(*userInfoString(async.results()[0].error(), zlka_client::kBusErrorNameKey), "org.freedesktop.DBus.Error.NoReply");
}

TEST_F(ClientBusTest, AnswersOfTheWrongFormAreMalformedReplies) {
  struct Case {
    EchoService::ReplyWriter write;
    std::function<zlka_client::Result<int>(zlka_client::ZLKAClient&)> call;
    std::string mentions;
  };
  auto metadata = [](zlka_client::ZLKAClient& c) -> zlka_client::Result<int> {
    auto r = c.requestMetadata({});
    if (!r.ok()) return r.error();
    return 0;
  };
  auto activation = [](zlka_client::ZLKAClient& c) -> zlka_client::Result<int> {
    auto r = c.requestActivation({});
    if (!r.ok()) return r.error();
    return 0;
  };
  auto confirmation = [](zlka_client::ZLKAClient& c) -> zlka_client::Result<int> {
    auto r = c.confirmActivation({});
    if (!r.ok()) return r.error();
    return 0;
  };
  std::vector<Case> cases = {
      {[](sd_bus_message* m) { return sd_bus_message_append(m, "sss", "p", "en_US", "{not json"); }, metadata, "not JSON"},
      {[](sd_bus_message* m) { return sd_bus_message_append(m, "sss", "p", "en_US", "\"scalar\""); }, metadata, "not JSON"},
      {[](sd_bus_message* m) { return sd_bus_message_append(m, "ss", "p", "en_US"); }, metadata, "\"ss\" instead of \"sss\""},
      {[](sd_bus_message* m) { return sd_bus_message_append(m, "s", "token"); }, activation, "\"s\" instead of \"ay\""},
      {[](sd_bus_message* m) { return sd_bus_message_append(m, "b", 1); }, confirmation, "\"b\" instead of \"\""},
  };
  for (const Case& c : cases) {
    service->answerWith(EchoService::custom(c.write));
    auto answer = c.call(*client);
    ASSERT_FALSE(answer.ok()) << c.mentions;
    EXPECT_EQ(answer.error().code(), code(ClientErrorCode::MalformedReply)) << c.mentions;
    EXPECT_NE(answer.error().localizedDescription().find(c.mentions), std::string::npos) << answer.error().localizedDescription();
  }
  // Metadata that is a JSON array is still JSON.
  service->answerWith(EchoService::custom([](sd_bus_message* m) { return sd_bus_message_append(m, "sss", "p", "de_DE", "[1,\"a\"]"); }));
  auto answer = client->requestMetadata({});
  ASSERT_TRUE(answer.ok()) << answer.error().description();
  EXPECT_EQ(answer.value().metadata, Value(platform::Array{Value(1), Value("a")}));
  EXPECT_EQ(answer.value().locale, "de_DE");
}

TEST(ClientConnectTest, AnUnreachableBusFailsToConnect) {
  auto missing = zlka_client::ZLKAClient::connect({.bus = "unix:path=/nonexistent/zlka-test-socket"});
  ASSERT_FALSE(missing.ok());
  EXPECT_EQ(missing.error().domain(), kClientErrorDomain);
  EXPECT_EQ(missing.error().code(), code(ClientErrorCode::ConnectionFailed));
  EXPECT_EQ(missing.error().localizedDescription(),
            "Cannot connect to the bus at \"unix:path=/nonexistent/zlka-test-socket\": No such file or directory.");
  EXPECT_EQ(zlkactl::exitStatusFor(missing.error()), zlkactl::kExitUnreachable);

  auto garbage = zlka_client::ZLKAClient::connect({.bus = "no-such-transport:x=1"});
  ASSERT_FALSE(garbage.ok());
  EXPECT_EQ(garbage.error().code(), code(ClientErrorCode::ConnectionFailed));
}

}  // namespace
}  // namespace client_test
