// The HTTP session against the reference server, for what the request pipeline's tests do not
// already drive: https only, TLS verification, the error codes, cancelling, the time-out cap.
#include "platform/http/http_session.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

#include "common/child_process.h"
#include "common/server_world.h"
#include "devserver/dev_server.h"

namespace {

using platform::HTTPSession;

[[maybe_unused]] ::testing::Environment* const kWorld =
    ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(true));
const zlkatest::ServerWorld& world() { return zlkatest::ServerWorld::get(); }

struct Outcome {
  std::optional<platform::Data> body;
  std::optional<platform::HTTPResponse> response;
  std::optional<platform::Error> error;
  bool onCallbackQueue = false;
};

// A GET of `url` on `s`, suspended; its one completion fulfils `done`.
std::shared_ptr<platform::HTTPTask> task(const std::shared_ptr<HTTPSession>& s, std::promise<Outcome>& done,
                                         const std::string& url) {
  return s->dataTaskWithRequest(platform::HTTPRequest(url, 0, 60.0), [&done, s](auto body, auto response, auto error) {
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
  const std::string crt = world().baseURL() + "/deviceservices/setup.crt";
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
  const std::string anotherCA = world().configuration().trustAnchor.string();
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
    HTTPSession::setMaximumTimeout(r.capMs ? std::optional(std::chrono::milliseconds(r.capMs)) : std::nullopt);
    auto c = platform::HTTPSessionConfiguration::ephemeralSessionConfiguration();
    c.caFile = r.caFile.value_or(c.caFile);
    c.maximumResponseSize = r.maximum;
    std::promise<Outcome> done;
    task(HTTPSession::sessionWithConfiguration(c), done, r.url)->resume();
    Outcome o = wait(done);
    EXPECT_TRUE(o.onCallbackQueue);
    if (r.code == 0) {
      ASSERT_FALSE(o.error) << o.error->description();
      EXPECT_EQ(o.response->statusCode, 200);
      EXPECT_EQ(o.response->valueForHTTPHeaderField("CONTENT-type"), "application/pkix-cert");
      EXPECT_EQ(o.body->bytes()[0], 0x30);  // a DER certificate
      continue;
    }
    ASSERT_TRUE(o.error);
    EXPECT_EQ(std::tuple(o.error->domain(), o.error->code()), std::tuple(platform::HTTPErrorDomain, r.code))
        << o.error->description();
    EXPECT_EQ(*o.error->userInfo()->at("FailingURL").string(), r.url);
    EXPECT_FALSE(o.response || o.body);
  }
}

TEST_F(HTTPSessionTest, CancellingCompletesEachTaskOnceWithCancelled) {
  world().admin().setFault({{"endpoint", "setup.crt"}, {"delay_ms", 2000}});
  auto s = HTTPSession::sessionWithConfiguration(platform::HTTPSessionConfiguration::ephemeralSessionConfiguration());
  std::promise<Outcome> done[4];
  auto notStarted = task(s, done[0], crt);
  notStarted->cancel();
  notStarted->resume();  // stays cancelled
  auto started = task(s, done[1], crt);
  started->resume();
  started->cancel();
  started->cancel();  // a second completion would set the promise twice and end the process
  task(s, done[2], crt)->resume();
  s->invalidateAndCancel();
  task(s, done[3], crt)->resume();  // refused once invalidated
  for (auto& d : done) EXPECT_EQ(wait(d).error->code(), platform::HTTPErrorCancelled);
  s->callbackQueue()->sync([] {});  // any second completion would have run by now
}

// A server that closes idle connections after a second: the requests that follow a longer idle,
// after one call and after a burst alike, go out on connections the server closed, which the
// session must notice and send again on fresh ones, never failing a request the server never saw.
TEST_F(HTTPSessionTest, RequestsAfterTheServersKeepAliveRanOutStillArrive) {
  zlkatest::TempDir dir;
  devserver::DevServerOptions options;
  options.stateDir = dir.path();
  options.keepAlive = std::chrono::seconds(1);
  devserver::DevServer server(options);
  ASSERT_EQ(server.start(), std::nullopt);
  auto c = platform::HTTPSessionConfiguration::ephemeralSessionConfiguration();
  c.caFile = (dir.path() / "ca.pem").string();
  auto s = HTTPSession::sessionWithConfiguration(c);
  for (int burst : {1, 8, 8}) {
    std::vector<std::promise<Outcome>> done(burst);
    for (auto& d : done) {
      platform::HTTPRequest request(server.baseURL() + "/deviceservices/queryProductPlan", 0, 30.0);
      request.HTTPMethod = "POST";
      s->uploadTaskWithRequest(request, platform::Data::fromString("{}"), [&d](auto body, auto response, auto error) {
         d.set_value({std::move(body), std::move(response), std::move(error)});
       })->resume();
    }
    for (auto& d : done) {
      Outcome o = wait(d);
      EXPECT_FALSE(o.error) << "after a burst of " << burst << ": " << o.error->description();
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
  }
}

}  // namespace
