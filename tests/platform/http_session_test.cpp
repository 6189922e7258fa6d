// The HTTP session against the reference server, for what the request pipeline's tests do not
// already drive: https only, TLS verification, the error codes, cancelling, the time-out cap.
#include "platform/http_session.h"

#include <gtest/gtest.h>

#include <future>

#include "common/server_world.h"

using platform::Data;
using platform::Error;
using platform::HTTPRequest;
using platform::HTTPResponse;
using platform::HTTPSession;

namespace {

[[maybe_unused]] ::testing::Environment* const kWorld = ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(true));

const zlkatest::ServerWorld& world() { return zlkatest::ServerWorld::get(); }

struct Outcome {
  std::optional<Data> body;
  std::optional<HTTPResponse> response;
  std::optional<Error> error;
  bool onCallbackQueue = false;
};

std::shared_ptr<HTTPSession> session(std::optional<std::string> caFile = std::nullopt, size_t maximum = 16u << 20) {
  auto c = platform::HTTPSessionConfiguration::ephemeralSessionConfiguration();  // the configuration's CA file
  c.caFile = caFile.value_or(c.caFile);
  c.maximumResponseSize = maximum;
  return HTTPSession::sessionWithConfiguration(c);
}

std::string certificateURL() { return world().baseURL() + "/deviceservices/setup.crt"; }

std::shared_ptr<platform::HTTPTask> start(const std::shared_ptr<HTTPSession>& s, std::promise<Outcome>& done,
                                          const std::string& url) {
  return s->dataTaskWithRequest(HTTPRequest(url, 0, 60.0), [&done, s](auto body, auto response, auto error) {
    done.set_value({std::move(body), std::move(response), std::move(error), s->callbackQueue()->isCurrent()});
  });
}

Outcome wait(std::promise<Outcome>& done) {
  auto f = done.get_future();
  EXPECT_EQ(f.wait_for(std::chrono::seconds(30)), std::future_status::ready);
  return f.get();
}

class HTTPSessionTest : public testing::Test {
 protected:
  void TearDown() override {
    HTTPSession::setMaximumTimeout(std::nullopt);
    world().admin().clearFaults();
  }
};

TEST_F(HTTPSessionTest, EachTransportFailureHasItsCodeAndNoResponse) {
  struct Row {
    const char* name;
    std::string url;
    std::optional<std::string> caFile;  // nullopt: the configuration's, which knows the server's CA
    nlohmann::json fault;
    int64_t code;  // 0: an answer
    size_t maximum = 16u << 20;
    int capMs = 0;
  };
  const std::string crt = certificateURL(), anotherCA = world().configuration().trustAnchor.string();
  // clang-format off
  const Row rows[] = {
      {"verified", crt, {}, nullptr, 0},
      {"no URL", "", {}, nullptr, platform::HTTPErrorBadURL},
      {"plain http", "http://127.0.0.1:1/x", {}, nullptr, platform::HTTPErrorBadURL},  // only https is spoken
      {"refused", world().refusedURL() + "/x", {}, nullptr, platform::HTTPErrorCannotConnectToHost},
      {"system store", crt, "", nullptr, platform::HTTPErrorSecureConnectionFailed},  // does not know the private CA
      {"another CA", crt, anotherCA, nullptr, platform::HTTPErrorSecureConnectionFailed},
      {"dropped", crt, {}, {{"endpoint", "setup.crt"}, {"drop", true}, {"remaining", 1}}, platform::HTTPErrorNetworkConnectionLost},
      {"over the cap", crt, {}, {{"endpoint", "setup.crt"}, {"delay_ms", 3000}, {"remaining", 1}}, platform::HTTPErrorTimedOut, 16u << 20, 200},
      {"oversized", crt, {}, nullptr, platform::HTTPErrorResourceTooLarge, 16},
  };
  // clang-format on
  for (const Row& r : rows) {
    SCOPED_TRACE(r.name);
    if (!r.fault.is_null()) world().admin().setFault(r.fault);
    if (r.capMs) HTTPSession::setMaximumTimeout(std::chrono::milliseconds(r.capMs));
    std::promise<Outcome> done;
    start(session(r.caFile, r.maximum), done, r.url)->resume();
    Outcome o = wait(done);
    HTTPSession::setMaximumTimeout(std::nullopt);
    EXPECT_TRUE(o.onCallbackQueue);
    if (r.code == 0) {
      ASSERT_FALSE(o.error) << o.error->description();
      EXPECT_EQ(o.response->statusCode, 200);
      EXPECT_EQ(o.response->valueForHTTPHeaderField("CONTENT-type"), "application/pkix-cert");
      EXPECT_EQ(o.body->bytes()[0], 0x30);  // a DER certificate
      continue;
    }
    ASSERT_TRUE(o.error);
    EXPECT_EQ(o.error->domain(), platform::HTTPErrorDomain);
    EXPECT_EQ(o.error->code(), r.code) << o.error->description();
    EXPECT_EQ(*o.error->userInfo()->at("FailingURL").string(), r.url);
    EXPECT_FALSE(o.response || o.body);
  }
}

TEST_F(HTTPSessionTest, CancellingCompletesEachTaskOnceWithCancelled) {
  world().admin().setFault({{"endpoint", "setup.crt"}, {"delay_ms", 2000}});
  auto s = session();
  std::promise<Outcome> done[4];
  auto notStarted = start(s, done[0], certificateURL());
  notStarted->cancel();
  notStarted->resume();  // stays cancelled
  auto started = start(s, done[1], certificateURL());
  started->resume();
  started->cancel();
  started->cancel();  // a second completion would set the promise twice and end the process
  start(s, done[2], certificateURL())->resume();
  s->invalidateAndCancel();
  start(s, done[3], certificateURL())->resume();  // refused once invalidated
  for (auto& d : done) EXPECT_EQ(wait(d).error->code(), platform::HTTPErrorCancelled);
  s->callbackQueue()->sync([] {});  // any second completion would have run by now
}

}  // namespace
