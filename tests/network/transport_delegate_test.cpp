// The session's delegate methods called directly: what they pass on, and what they do with no
// completion or no handshake data.
#include <fstream>
#include <iterator>
#include <vector>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/semaphore.h"

namespace nettest {
namespace {

using platform::Data;
using platform::Error;
using platform::LogLevel;

struct Delivered {
  platform::Semaphore done;
  std::atomic<int> calls{0};
  std::optional<Data> data;
  std::optional<Error> error;
};

TarvexSAPDataCompletion into(const std::shared_ptr<Delivered>& d) {
  return [d](std::optional<Data> data, std::optional<Error> error) {
    if (d->calls++ == 0) {
      d->data = std::move(data);
      d->error = std::move(error);
    }
    d->done.signal();
  };
}

class TransportDelegateTest : public NetworkTest {};

TEST_F(TransportDelegateTest, CertificateIsPassedOnAsReceived) {
  auto delivered = std::make_shared<Delivered>();
  network()->sessionRequestCertificateWithCompletionHandler(*network()->tarvexSAPSession(), into(delivered));
  ASSERT_TRUE(delivered->done.waitFor(kReplyGuard));
  ASSERT_TRUE(delivered->data);
  EXPECT_FALSE(delivered->error);
  std::ifstream file(environment().stateDir() / "setup.crt", std::ios::binary);
  const std::vector<uint8_t> der((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
  EXPECT_EQ(delivered->data->toVector(), der);
  // Any non-empty body is passed on: the transport does not judge certificates.
  admin().setFault({{"endpoint", "setup.crt"}, {"body", "not a certificate"}});
  auto odd = std::make_shared<Delivered>();
  network()->sessionRequestCertificateWithCompletionHandler(*network()->tarvexSAPSession(), into(odd));
  ASSERT_TRUE(odd->done.waitFor(kReplyGuard));
  EXPECT_EQ(odd->data, Data::fromString("not a certificate"));
  EXPECT_EQ(odd->calls.load(), 1);
}

// With no completion there is nobody to answer: the first line is logged and nothing is sent.
TEST_F(TransportDelegateTest, NoCompletionMeansNoRequest) {
  network()->sessionRequestCertificateWithCompletionHandler(*network()->tarvexSAPSession(), nullptr);
  network()->sessionRequestHandshakeWithServerCompletionHandler(*network()->tarvexSAPSession(), Data::fromString("x"),
                                                                nullptr);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Requesting certificate for Tarvex SAP session..."), 1);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Requesting handshake for Tarvex SAP session..."), 1);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] self._selected"), 0);
  EXPECT_EQ(admin().requests("setup.crt"), 0u);
  EXPECT_EQ(admin().requests("sapSession"), 0u);
}

TEST_F(TransportDelegateTest, NoHandshakeDataIsAnInvalidParameter) {
  auto delivered = std::make_shared<Delivered>();
  network()->sessionRequestHandshakeWithServerCompletionHandler(*network()->tarvexSAPSession(), std::nullopt,
                                                                into(delivered));
  ASSERT_TRUE(delivered->done.waitFor(kReplyGuard));
  EXPECT_FALSE(delivered->data);
  ASSERT_TRUE(delivered->error);
  EXPECT_EQ(*delivered->error, Error(TarvexSAPSessionErrorDomain, TarvexSAPSessionErrorInvalidParameter));
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] handshakeData = nil!"), 1);
  EXPECT_EQ(admin().requests("sapSession"), 0u);
}

// Whatever the server's answer held besides its two members is ignored; the session info is
// handed on decoded.
TEST_F(TransportDelegateTest, HandshakeAnswerIsDecodedAndExtraMembersIgnored) {
  admin().setFault(
      {{"endpoint", "sapSession"},
       {"status", 200},
       {"body", R"({"session-info":"AQID","session-validity":60,"server":"dev","session-validity-unit":"s"})"}});
  auto delivered = std::make_shared<Delivered>();
  network()->sessionRequestHandshakeWithServerCompletionHandler(*network()->tarvexSAPSession(),
                                                                Data::fromString("request"), into(delivered));
  ASSERT_TRUE(delivered->done.waitFor(kReplyGuard));
  EXPECT_FALSE(delivered->error) << log().dump();
  EXPECT_EQ(delivered->data, Data(std::vector<uint8_t>{1, 2, 3}));
  EXPECT_TRUE(log().findStartingWith("[#TarvexSAPSession] Setting TTL... (TTL: 60.000000,")) << log().dump();
}

}  // namespace
}  // namespace nettest
