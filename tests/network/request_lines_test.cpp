// The line each operation logs on arrival, before anything else: the token and the uuid are
// private, and show only when the log is set to show private data.
#include <string>

#include "network_test_environment.h"
#include "operation_calls.h"

namespace nettest {
namespace {

using platform::LogLevel;

class RequestLinesTest : public NetworkTest {
 protected:
  void TearDown() override {
    platform::LogSettings settings = platform::currentLogSettings();
    settings.privateData = true;
    platform::configureLog(settings);
    NetworkTest::TearDown();
  }
  static void showPrivateData(bool show) {
    platform::LogSettings settings = platform::currentLogSettings();
    settings.privateData = show;
    platform::configureLog(settings);
  }
};

TEST_F(RequestLinesTest, ArrivalLinesHideTokenAndUUID) {
  showPrivateData(false);
  auto outsider = peerWithEntitlement(std::nullopt);  // refused at once: only the arrival line matters
  const size_t metadata = requestMetadata(MetadataCall().withLocale("fr_FR"), outsider.get()).logStart;
  const size_t activation = requestActivation({}, outsider.get()).logStart;
  const size_t confirmation = confirmActivation({}, outsider.get()).logStart;
  const auto entries = log().entries();
  ASSERT_GT(entries.size(), confirmation);
  EXPECT_EQ(entries[metadata].level, LogLevel::Default);
  EXPECT_EQ(entries[metadata].message,
            "[#TokenAuth] Requesting PPID metadata for token: <private> (token.length: 19, uuid: <private>, "
            "requestedLocale: fr_FR)");
  EXPECT_EQ(entries[activation].message,
            "[#TokenAuth] Requesting activation for token: <private> (token.length: 19, uuid: <private>)");
  EXPECT_EQ(entries[confirmation].message,
            "[#TokenAuth] Confirming activation for token: <private> (token.length: 19, uuid: <private>)");
  EXPECT_EQ(log().countContaining(kSampleUUID), 0) << log().dump();
}

TEST_F(RequestLinesTest, ArrivalLinesShowPrivateDataWhenAsked) {
  auto outsider = peerWithEntitlement(std::nullopt);
  const platform::Data token = sampleToken();
  const size_t at = confirmActivation({}, outsider.get()).logStart;
  EXPECT_EQ(log().entries()[at].message, "[#TokenAuth] Confirming activation for token: " + token.description() +
                                             " (token.length: 19, uuid: " + kSampleUUID + ")");
  const size_t nil =
      requestMetadata(MetadataCall().withToken(std::nullopt).withUUID(std::nullopt).withLocale(std::nullopt),
                      outsider.get())
          .logStart;
  EXPECT_EQ(log().entries()[nil].message,
            "[#TokenAuth] Requesting PPID metadata for token: (null) (token.length: 0, uuid: (null), requestedLocale: "
            "(null))");
}

// A server that refuses connections fails every operation as a transport error.
TEST_F(RequestLinesTest, RefusedConnectionIsATransportError) {
  ScopedConfiguration refused([](platform::Configuration& c) { c.servers["prod"].api = environment().refusedURL(); });
  ScopedConfiguration sap([](platform::Configuration& c) { c.servers["it"].api = environment().baseURL(); });
  suite().set("TarvexSAPServer", "it");  // the session itself still opens
  for (int op = 0; op < 3; ++op) {
    SCOPED_TRACE(op);
    const size_t start = log().size();
    if (op == 0) expectFailure(requestMetadata(), -5);
    if (op == 1) expectFailure(requestActivation(), -5);
    if (op == 2) expectFailure(confirmActivation(), -5);
    expectLine(LogLevel::Fault, "[#TokenAuth] taskError: Error Domain=HTTPErrorDomain Code=-1004 ", start);
  }
  EXPECT_EQ(admin().handshakes(), 1u);
}

}  // namespace
}  // namespace nettest
