// The entitlement gate: the caller's peer must hold "token-auth" in the service's entitlement. It
// comes right after the request line and before everything else, arguments included.
#include <future>
#include <ostream>
#include <string>
#include <vector>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "support/errors.h"

namespace nettest {
namespace {

using platform::Array;
using platform::Dictionary;
using platform::Value;

struct Peer {
  const char* name;
  std::optional<Value> entitlement;
};

// Shown by the test runner in place of the bytes of the parameter.
void PrintTo(const Peer& c, std::ostream* out) { *out << c.name; }

class EntitlementGateTest : public NetworkTest, public ::testing::WithParamInterface<Peer> {};

TEST_P(EntitlementGateTest, RefusesPeersWithoutTheCategory) {
  auto peer = peerWithEntitlement(GetParam().entitlement);
  for (bool nilArguments : {false, true}) {
    SCOPED_TRACE(nilArguments ? "nil arguments" : "valid arguments");
    MetadataCall metadata;
    TokenCall call;
    if (nilArguments) {
      metadata.withToken(std::nullopt).withUUID(std::nullopt).withLocale(std::nullopt);
      call.withToken(std::nullopt).withUUID(std::nullopt);
    }
    const MetadataOutcome m = requestMetadata(metadata, peer.get());
    expectFailure(m, ZLKAErrorMissingEntitlement);
    // The request line comes first, then the refusal.
    const auto entry = log().findStartingWith("[#TokenAuth] Requesting PPID metadata for token: ", m.logStart);
    ASSERT_TRUE(entry) << log().dump();
    EXPECT_LT(*entry, m.logMark);
    expectFailure(requestActivation(call, peer.get()), ZLKAErrorMissingEntitlement);
    expectFailure(confirmActivation(call, peer.get()), ZLKAErrorMissingEntitlement);
  }
  const auto stats = admin().stats();
  for (const auto& [endpoint, n] : stats["requests"].items()) EXPECT_EQ(n.get<uint64_t>(), 0u) << endpoint;
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Invalid locale identifier"), 0);
}

INSTANTIATE_TEST_SUITE_P(Peers, EntitlementGateTest,
                         ::testing::Values(Peer{"no_entitlement", std::nullopt},
                                           Peer{"other_category", Value(Array{Value("token-admin")})},
                                           Peer{"empty_array", Value(Array{})}, Peer{"bare_true", Value(true)},
                                           Peer{"plain_string", Value("token-auth")},
                                           Peer{"category_false", Value(Dictionary{{"token-auth", false}})},
                                           Peer{"category_as_text", Value(Dictionary{{"token-auth", "yes"}})},
                                           Peer{"other_key_true", Value(Dictionary{{"token-admin", true}})},
                                           Peer{"category_zero", Value(Dictionary{{"token-auth", 0}})}),
                         [](const ::testing::TestParamInfo<Peer>& info) { return std::string(info.param.name); });

class EntitledPeersTest : public NetworkTest, public ::testing::WithParamInterface<Peer> {};

TEST_P(EntitledPeersTest, AdmitsPeersWithTheCategory) {
  auto peer = peerWithEntitlement(GetParam().entitlement);
  EXPECT_FALSE(requestMetadata({}, peer.get()).error) << log().dump();
  EXPECT_FALSE(requestActivation({}, peer.get()).error);
  EXPECT_FALSE(confirmActivation({}, peer.get()).error);
}

INSTANTIATE_TEST_SUITE_P(
    Peers, EntitledPeersTest,
    ::testing::Values(Peer{"array_with_category", Value(Array{Value("other"), Value("token-auth")})},
                      Peer{"category_true", Value(Dictionary{{"token-auth", true}})},
                      Peer{"category_one", Value(Dictionary{{"token-auth", 1}, {"other", false}})}),
    [](const ::testing::TestParamInfo<Peer>& info) { return std::string(info.param.name); });

// A call that arrives with no connection being served has no peer to admit.
TEST(EntitlementGateWithoutConnectionTest, RefusesACallFromNoConnection) {
  ASSERT_EQ(platform::Connection::currentConnection(), nullptr);
  struct Box {
    int replies = 0;
    std::optional<platform::Error> error;
  };
  auto box = std::make_shared<Box>();
  ZLKANetwork::sharedInstance()->confirmActivationForToken(sampleToken(), std::string(kSampleUUID),
                                                           [box](std::optional<platform::Error> error) {
                                                             ++box->replies;
                                                             box->error = std::move(error);
                                                           });
  // The refusal is made before anything asynchronous starts: the reply has already come.
  EXPECT_EQ(box->replies, 1);
  expectServiceError(box->error, ZLKAErrorMissingEntitlement);
}

class ExportedObjectTest : public NetworkTest {};

// The exported object hands every call to the shared instance unchanged.
TEST_F(ExportedObjectTest, ExportedObjectForwardsToTheSharedInstance) {
  std::shared_ptr<ZLKANetworkProtocol> exported = network()->exportedObject();
  ASSERT_TRUE(exported);
  auto peer = entitledPeer();
  platform::Connection::CurrentScope scope(peer.get());
  auto done = std::make_shared<std::promise<std::optional<platform::Error>>>();
  exported->confirmActivationForToken(
      sampleToken(), std::string(kSampleUUID),
      [done](std::optional<platform::Error> error) { done->set_value(std::move(error)); });
  auto future = done->get_future();
  ASSERT_EQ(future.wait_for(kReplyGuard), std::future_status::ready);
  EXPECT_FALSE(future.get());
  EXPECT_EQ(admin().requests("ackAccessory"), 1u);
}

}  // namespace
}  // namespace nettest
