#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <future>

#include "devserver/dev_server.h"
#include "platform/http_session.h"
#include "platform/json.h"

using platform::Data;
using platform::Error;
using platform::HTTPRequest;
using platform::HTTPResponse;
using platform::HTTPSession;
using platform::HTTPSessionConfiguration;

namespace {

struct Outcome {
  std::optional<Data> body;
  std::optional<HTTPResponse> response;
  std::optional<Error> error;
  bool onCallbackQueue = false;
};

class HTTPSessionTest : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    dir = "/tmp/zlka-http-" + std::to_string(getpid());
    devserver::DevServerOptions options;
    options.stateDir = dir;
    options.admin = true;
    server = new devserver::DevServer(options);
    ASSERT_EQ(server->start(), std::nullopt);
  }
  static void TearDownTestSuite() {
    delete server;
    std::filesystem::remove_all(dir);
  }
  void TearDown() override {
    HTTPSession::setMaximumTimeout(std::nullopt);
    Outcome cleared = run(session(), request("DELETE", "/_admin/faults"));
    EXPECT_FALSE(cleared.error);
  }

  static std::shared_ptr<HTTPSession> session(std::string caFile = (std::filesystem::path(dir) / "ca.pem").string(),
                                              size_t maximum = 16u << 20) {
    HTTPSessionConfiguration c;
    c.caFile = std::move(caFile);
    c.maximumResponseSize = maximum;
    return HTTPSession::sessionWithConfiguration(c);
  }

  static HTTPRequest request(const std::string& method, const std::string& path) {
    HTTPRequest r(server->baseURL() + path, 0, 60.0);
    r.HTTPMethod = method;
    return r;
  }

  static Outcome run(const std::shared_ptr<HTTPSession>& s, HTTPRequest r, std::optional<Data> body = std::nullopt) {
    std::promise<Outcome> done;
    auto completion = [&done, s](std::optional<Data> b, std::optional<HTTPResponse> resp, std::optional<Error> e) {
      done.set_value({std::move(b), std::move(resp), std::move(e), s->callbackQueue()->isCurrent()});
    };
    auto task = body ? s->uploadTaskWithRequest(std::move(r), *body, completion) : s->dataTaskWithRequest(std::move(r), completion);
    task->resume();
    auto f = done.get_future();
    EXPECT_EQ(f.wait_for(std::chrono::seconds(30)), std::future_status::ready);
    return f.get();
  }

  static void fault(const std::string& json) {
    Outcome o = run(session(), request("POST", "/_admin/faults"), Data::fromString(json));
    ASSERT_TRUE(o.response && o.response->statusCode == 200) << json;
  }

  static inline std::string dir;
  static inline devserver::DevServer* server = nullptr;
};

}  // namespace

TEST_F(HTTPSessionTest, AnswersArriveOnTheCallbackQueueWithBodyAndHeaders) {
  Outcome o = run(session(), request("GET", "/deviceservices/setup.crt"));
  ASSERT_FALSE(o.error) << o.error->description();
  EXPECT_TRUE(o.onCallbackQueue);
  EXPECT_EQ(o.response->statusCode, 200);
  ASSERT_TRUE(o.body);
  EXPECT_EQ(o.body->bytes()[0], 0x30);  // a DER certificate
  EXPECT_EQ(o.response->valueForHTTPHeaderField("content-type"), "application/pkix-cert");
  EXPECT_EQ(o.response->valueForHTTPHeaderField("CONTENT-TYPE"), "application/pkix-cert");
}

TEST_F(HTTPSessionTest, UploadsTheBodyAndReportsAnyStatusAsAnAnswer) {
  HTTPRequest r = request("POST", "/deviceservices/sapSession");
  r.setValueForHTTPHeaderField("application/json", "Content-Type");
  Outcome o = run(session(), r, Data::fromString("{\"session-request\": \"AAAA\", \"session-identifier\": \"X\"}"));
  ASSERT_FALSE(o.error);
  EXPECT_EQ(o.response->statusCode, 400);  // the server read the body and refused its contents
  auto parsed = platform::json::parse(o.body->view());
  ASSERT_TRUE(parsed);
  EXPECT_TRUE(parsed->find("error"));
}

// A port bound but not listening: connections to it are refused for as long as the socket lives.
struct RefusingPort {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  uint16_t port = 0;
  RefusingPort() {
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t n = sizeof a;
    if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 && ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &n) == 0)
      port = ntohs(a.sin_port);
  }
  ~RefusingPort() { ::close(fd); }
};

TEST_F(HTTPSessionTest, TransportFailuresAreErrorsWithoutAResponse) {
  RefusingPort refusing;
  ASSERT_NE(refusing.port, 0);
  struct Case {
    std::string url;
    int64_t code;
  };
  const Case cases[] = {
      {"", platform::HTTPErrorBadURL},
      {"http://127.0.0.1:1/x", platform::HTTPErrorBadURL},  // only https is spoken
      {"https://127.0.0.1:" + std::to_string(refusing.port) + "/x", platform::HTTPErrorCannotConnectToHost},
  };
  for (const Case& c : cases) {
    Outcome o = run(session(), HTTPRequest(c.url, 0, 60.0));
    ASSERT_TRUE(o.error) << c.url;
    EXPECT_EQ(o.error->domain(), platform::HTTPErrorDomain);
    EXPECT_EQ(o.error->code(), c.code) << c.url << ": " << o.error->description();
    EXPECT_FALSE(o.response);
    EXPECT_FALSE(o.body);
    EXPECT_EQ(*o.error->userInfo()->at("FailingURL").string(), c.url);
  }
}

TEST_F(HTTPSessionTest, TLSIsAlwaysVerified) {
  // The system store does not know the server's private CA, nor does a CA file of another CA.
  Outcome system = run(session(""), request("GET", "/deviceservices/setup.crt"));
  ASSERT_TRUE(system.error);
  EXPECT_EQ(system.error->code(), platform::HTTPErrorSecureConnectionFailed);
  Outcome wrong = run(session((std::filesystem::path(dir) / "sap-root.pem").string()), request("GET", "/deviceservices/setup.crt"));
  ASSERT_TRUE(wrong.error);
  EXPECT_EQ(wrong.error->code(), platform::HTTPErrorSecureConnectionFailed);
}

TEST_F(HTTPSessionTest, TimeOutsAndDroppedConnections) {
  fault(R"({"endpoint": "setup.crt", "delay_ms": 3000, "remaining": 1})");
  HTTPSession::setMaximumTimeout(std::chrono::milliseconds(200));
  Outcome slow = run(session(), request("GET", "/deviceservices/setup.crt"));
  ASSERT_TRUE(slow.error);
  EXPECT_EQ(slow.error->code(), platform::HTTPErrorTimedOut);
  HTTPSession::setMaximumTimeout(std::nullopt);

  fault(R"({"endpoint": "setup.crt", "drop": true, "remaining": 1})");
  Outcome dropped = run(session(), request("GET", "/deviceservices/setup.crt"));
  ASSERT_TRUE(dropped.error);
  EXPECT_EQ(dropped.error->code(), platform::HTTPErrorNetworkConnectionLost) << dropped.error->description();
}

TEST_F(HTTPSessionTest, OversizedAnswersFail) {
  Outcome o = run(session((std::filesystem::path(dir) / "ca.pem").string(), 16), request("GET", "/deviceservices/setup.crt"));
  ASSERT_TRUE(o.error);
  EXPECT_EQ(o.error->code(), platform::HTTPErrorResourceTooLarge);
}

TEST_F(HTTPSessionTest, CancellingCompletesOnceWithCancelled) {
  fault(R"({"endpoint": "setup.crt", "delay_ms": 2000})");
  auto s = session();
  std::promise<Outcome> done;
  std::atomic<int> calls{0};
  auto task = s->dataTaskWithRequest(request("GET", "/deviceservices/setup.crt"),
                                     [&](std::optional<Data> b, std::optional<HTTPResponse> r, std::optional<Error> e) {
                                       if (calls.fetch_add(1) == 0) done.set_value({std::move(b), std::move(r), std::move(e)});
                                     });
  task->resume();
  task->cancel();
  task->cancel();
  auto f = done.get_future();
  ASSERT_EQ(f.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  Outcome o = f.get();
  ASSERT_TRUE(o.error);
  EXPECT_EQ(o.error->code(), platform::HTTPErrorCancelled);
  s->callbackQueue()->sync([] {});  // any second completion would have run by now
  EXPECT_EQ(calls.load(), 1);
}

TEST_F(HTTPSessionTest, InvalidateAndCancelEndsEverythingAndRefusesNewTasks) {
  fault(R"({"endpoint": "setup.crt", "delay_ms": 2000})");
  auto s = session();
  constexpr int kTasks = 5;
  std::vector<std::promise<int64_t>> codes(kTasks);
  for (int i = 0; i < kTasks; ++i)
    s->dataTaskWithRequest(request("GET", "/deviceservices/setup.crt"), [&codes, i](auto, auto, std::optional<Error> e) {
       codes[i].set_value(e ? e->code() : 0);
     })->resume();
  s->invalidateAndCancel();
  for (auto& c : codes) {
    auto f = c.get_future();
    ASSERT_EQ(f.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_EQ(f.get(), platform::HTTPErrorCancelled);
  }
  Outcome late = run(s, request("GET", "/deviceservices/setup.crt"));
  ASSERT_TRUE(late.error);
  EXPECT_EQ(late.error->code(), platform::HTTPErrorCancelled);
}

TEST_F(HTTPSessionTest, ManyRequestsOnOneSessionAllComplete) {
  auto s = session();
  constexpr int kRequests = 50;
  std::vector<std::promise<long>> statuses(kRequests);
  for (int i = 0; i < kRequests; ++i)
    s->dataTaskWithRequest(request("GET", "/deviceservices/setup.crt"), [&statuses, i](auto, std::optional<HTTPResponse> r, auto) {
       statuses[i].set_value(r ? r->statusCode : 0);
     })->resume();
  for (auto& p : statuses) {
    auto f = p.get_future();
    ASSERT_EQ(f.wait_for(std::chrono::seconds(30)), std::future_status::ready);
    EXPECT_EQ(f.get(), 200);
  }
}
