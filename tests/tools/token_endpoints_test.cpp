// The three signed token endpoints: success answers signed for the device, the 401 rules of
// the signature check, the 400 rules of the body, and the transport-level errors.
#include <gtest/gtest.h>

#include "devserver/strict_base64.h"
#include "devserver_test_support.h"

namespace devtest {
namespace {

using devserver::base64Encode;
using devserver::DevServerOptions;

class TokenEndpoints : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(device.associate(*client)); }

  TestServer server{adminOptions()};
  std::unique_ptr<httplib::SSLClient> client = server.client();
  Device device{server};
};

TEST_F(TokenEndpoints, EachEndpointAnswersWithASignatureTheDeviceAccepts) {
  const Bytes token = sampleToken("accessory-1");

  const auto plan = device.post(*client, "queryProductPlan", tokenBody({token}, "uuid-1", "fr_FR"));
  ASSERT_TRUE(plan);
  ASSERT_EQ(plan->status, 200) << plan->body;
  EXPECT_TRUE(device.verifies(*plan));
  const json planReply = json::parse(plan->body);
  EXPECT_EQ(planReply.at("ppid"), "PP-0001-ACCESSORY");
  EXPECT_EQ(planReply.at("locale"), "fr_FR");
  EXPECT_TRUE(planReply.at("ppid_metadata").is_object());
  EXPECT_TRUE(planReply.at("ppid_metadata").at("name").is_string());

  const auto activation = device.post(*client, "activateAccessory", tokenBody({token}, "uuid-1"));
  ASSERT_TRUE(activation);
  ASSERT_EQ(activation->status, 200) << activation->body;
  EXPECT_TRUE(device.verifies(*activation));
  EXPECT_EQ(json::parse(activation->body).at("tokens").size(), 2u);

  const auto ack = device.post(*client, "ackAccessory", tokenBody({token}, "uuid-1"));
  ASSERT_TRUE(ack);
  EXPECT_EQ(ack->status, 204);
  EXPECT_TRUE(ack->body.empty());
  EXPECT_TRUE(device.verifies(*ack));  // signed over the empty body

  // A response signature is single-use on the device side.
  EXPECT_FALSE(device.verify(plan->get_header_value("signature"), plan->body));
  const json stats = server.stats();
  EXPECT_EQ(stats.at("verified"), 3);
  EXPECT_EQ(stats.at("rejected"), 0);
}

TEST_F(TokenEndpoints, QueryAcceptsRequestInfoAndSeveralTokenItems) {
  const std::string body = tokenBody({sampleToken("a"), sampleToken("b"), derItem(0x04, bytesOf("c"))}, "u", "de_DE",
                                     json{{"reason", "setup"}, {"attempt", 2}});
  const auto answer = device.post(*client, "queryProductPlan", body);
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 200) << answer->body;
  EXPECT_EQ(json::parse(answer->body).at("locale"), "de_DE");
  EXPECT_TRUE(device.verifies(*answer));
}

TEST_F(TokenEndpoints, SignatureCheckFailuresAre401AndUnsigned) {
  const std::string body = tokenBody({sampleToken("a")});
  const std::string signature = device.sign(body);
  std::string tampered = body;
  tampered.back() = ' ';
  tampered += "}";

  struct Case {
    const char* what;
    httplib::Headers headers;
    std::string body;
    const char* error;
  };
  const std::vector<Case> cases = {
      {"no headers", {}, body, "missing session-identifier header"},
      {"no signature", {{"session-identifier", kSessionId}}, body, "missing signature header"},
      {"no session identifier", {{"signature", signature}}, body, "missing session-identifier header"},
      {"unknown session", sessionHeaders("00000000-0000-0000-0000-000000000000", signature), body, "unknown session"},
      {"signature not base64", sessionHeaders(kSessionId, signature.substr(1)), body, "signature header is not base64"},
      {"signature too short", sessionHeaders(kSessionId, base64Encode(bytesOf("short"))), body, "bad signature"},
      {"body changed after signing", sessionHeaders(kSessionId, signature), tampered, "bad signature"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    for (const char* endpoint : {"queryProductPlan", "activateAccessory", "ackAccessory"}) {
      const auto answer =
          client->Post((std::string("/deviceservices/") + endpoint).c_str(), c.headers, c.body, "application/json");
      ASSERT_TRUE(answer);
      EXPECT_EQ(answer->status, 401) << endpoint;
      EXPECT_EQ(json::parse(answer->body).at("error"), c.error) << endpoint;
      EXPECT_FALSE(answer->has_header("signature")) << endpoint;
    }
  }
  EXPECT_EQ(server.stats().at("rejected"), 3 * cases.size());
  EXPECT_EQ(server.stats().at("verified"), 0);
}

TEST_F(TokenEndpoints, ReplayedRequestIsRefusedAndTheSessionStillWorks) {
  const std::string body = tokenBody({sampleToken("a")});
  const httplib::Headers headers = sessionHeaders(kSessionId, device.sign(body));
  const auto first = client->Post("/deviceservices/ackAccessory", headers, body, "application/json");
  ASSERT_TRUE(first);
  EXPECT_EQ(first->status, 204);
  const auto replay = client->Post("/deviceservices/ackAccessory", headers, body, "application/json");
  ASSERT_TRUE(replay);
  EXPECT_EQ(replay->status, 401);
  EXPECT_EQ(json::parse(replay->body).at("error"), "replayed request");
  // The same signature is no good for another endpoint either.
  const auto elsewhere = client->Post("/deviceservices/activateAccessory", headers, body, "application/json");
  ASSERT_TRUE(elsewhere);
  EXPECT_EQ(elsewhere->status, 401);

  const auto fresh = device.post(*client, "ackAccessory", body);
  ASSERT_TRUE(fresh);
  EXPECT_EQ(fresh->status, 204);
}

TEST_F(TokenEndpoints, MalformedBodiesAre400AndStillSigned) {
  const std::string token = base64Encode(sampleToken("a"));
  struct Case {
    const char* what;
    std::string body;
    const char* endpoint;
  };
  const std::vector<Case> cases = {
      {"not JSON", "{\"tokens\": [", "activateAccessory"},
      {"trailing garbage", json{{"tokens", {token}}, {"uuid", "u"}}.dump() + "x", "activateAccessory"},
      {"not an object", "[\"" + token + "\"]", "activateAccessory"},
      {"tokens missing", json{{"uuid", "u"}}.dump(), "activateAccessory"},
      {"tokens a string", json{{"tokens", token}, {"uuid", "u"}}.dump(), "activateAccessory"},
      {"tokens empty", json{{"tokens", json::array()}, {"uuid", "u"}}.dump(), "ackAccessory"},
      {"token a number", json{{"tokens", {token, 5}}, {"uuid", "u"}}.dump(), "activateAccessory"},
      {"token not base64", json{{"tokens", {"%%%%"}}, {"uuid", "u"}}.dump(), "ackAccessory"},
      {"token base64 with white space", json{{"tokens", {token + "\n"}}, {"uuid", "u"}}.dump(), "ackAccessory"},
      {"token empty", json{{"tokens", {""}}, {"uuid", "u"}}.dump(), "ackAccessory"},
      {"uuid missing", json{{"tokens", {token}}}.dump(), "activateAccessory"},
      {"uuid a number", json{{"tokens", {token}}, {"uuid", 12}}.dump(), "ackAccessory"},
      {"locale missing", json{{"tokens", {token}}, {"uuid", "u"}}.dump(), "queryProductPlan"},
      {"locale null", json{{"tokens", {token}}, {"uuid", "u"}, {"locale", nullptr}}.dump(), "queryProductPlan"},
      {"request_info an array",
       json{{"tokens", {token}}, {"uuid", "u"}, {"locale", "en_US"}, {"request_info", json::array()}}.dump(),
       "queryProductPlan"},
      {"invalid UTF-8", "{\"tokens\":[\"" + token + "\"],\"uuid\":\"\xff\"}", "activateAccessory"},
      {"deeply nested", std::string(100000, '[') + std::string(100000, ']'), "queryProductPlan"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    const auto answer = device.post(*client, c.endpoint, c.body);
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, 400);
    const json error = json::parse(answer->body, nullptr, false);
    ASSERT_TRUE(error.is_object()) << answer->body;
    EXPECT_TRUE(error.at("error").is_string());
    EXPECT_TRUE(device.verifies(*answer));
  }
  EXPECT_EQ(server.stats().at("statuses").at("400"), cases.size());
}

TEST_F(TokenEndpoints, TransportErrorsAreJSON) {
  struct Case {
    const char* what;
    std::function<httplib::Result()> send;
    int status;
  };
  const std::string oversized(1024 * 1024 + 1, 'x');
  const std::string limit(1024 * 1024, ' ');
  const std::vector<Case> cases = {
      {"unknown path", [&] { return client->Get("/deviceservices/nothing"); }, 404},
      {"path outside the service", [&] { return client->Post("/", "{}", "application/json"); }, 404},
      {"long path", [&] { return client->Get(("/" + std::string(7000, 'a')).c_str()); }, 404},
      {"wrong method on a token endpoint", [&] { return client->Get("/deviceservices/queryProductPlan"); }, 405},
      {"wrong method on the certificate", [&] { return client->Post("/deviceservices/setup.crt", "", "x/y"); }, 405},
      {"PUT", [&] { return client->Put("/deviceservices/sapSession", "{}", "application/json"); }, 405},
      {"DELETE", [&] { return client->Delete("/deviceservices/ackAccessory"); }, 405},
      {"oversized body",
       [&] { return client->Post("/deviceservices/activateAccessory", oversized, "application/json"); }, 413},
      // Exactly 1 MiB is read and judged: unsigned, so 401.
      {"body at the limit",
       [&] { return client->Post("/deviceservices/activateAccessory", limit, "application/json"); }, 401},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    const auto answer = c.send();
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, c.status);
    EXPECT_EQ(answer->get_header_value("Content-Type"), "application/json");
    const json error = json::parse(answer->body, nullptr, false);
    ASSERT_TRUE(error.is_object()) << answer->body;
    EXPECT_TRUE(error.at("error").is_string());
  }
  const json stats = server.stats();
  EXPECT_EQ(stats.at("statuses").at("404"), 3);
  EXPECT_EQ(stats.at("statuses").at("405"), 4);
  EXPECT_EQ(stats.at("statuses").at("413"), 1);
  EXPECT_EQ(stats.at("requests").at("activateAccessory"), 2);
  // The session is unharmed by all of it.
  const auto answer = device.post(*client, "ackAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 204);
}

TEST_F(TokenEndpoints, ManyRequestsShareOneKeptAliveConnection) {
  constexpr int kRequests = 30;
  for (int i = 0; i < kRequests; ++i) {
    const auto answer =
        device.post(*client, i % 2 ? "ackAccessory" : "queryProductPlan", tokenBody({sampleToken("a")}, "u", "en_US"));
    ASSERT_TRUE(answer) << i;
    ASSERT_EQ(answer->status, i % 2 ? 204 : 200) << i;
    EXPECT_TRUE(device.verifies(*answer)) << i;
  }
  const auto stats = client->Get("/_admin/stats");  // on the same connection too
  ASSERT_TRUE(stats);
  EXPECT_EQ(json::parse(stats->body).at("connections"), 1);
  EXPECT_EQ(json::parse(stats->body).at("verified"), kRequests);
}

TEST_F(TokenEndpoints, ConcurrentDevicesAreServedSideBySide) {
  constexpr int kDevices = 12;
  std::vector<std::unique_ptr<Device>> devices;
  std::vector<std::unique_ptr<httplib::SSLClient>> clients;
  for (int i = 0; i < kDevices; ++i) {
    clients.push_back(server.client());
    devices.push_back(std::make_unique<Device>(server, "SESSION-" + std::to_string(i)));
    ASSERT_TRUE(devices.back()->associate(*clients.back()));
  }
  // Every client keeps its connection open while the others run: none may starve.
  std::vector<std::thread> threads;
  std::vector<int> successes(kDevices, 0);
  for (int i = 0; i < kDevices; ++i) {
    threads.emplace_back([&, i] {
      for (int n = 0; n < 5; ++n) {
        const auto answer = devices[i]->post(*clients[i], "activateAccessory", tokenBody({sampleToken("t")}, "u"));
        if (answer && answer->status == 200 && devices[i]->verifies(*answer)) {
          ++successes[i];
        }
      }
    });
  }
  for (std::thread& thread : threads) {
    thread.join();
  }
  for (int i = 0; i < kDevices; ++i) {
    EXPECT_EQ(successes[i], 5) << "device " << i;
  }
}

TEST(DevServerStop, IdleAndBusyConnectionsDoNotHoldUpStop) {
  auto server = std::make_unique<TestServer>(adminOptions());
  auto idle = server->client();
  ASSERT_TRUE(idle->Get("/deviceservices/setup.crt"));  // keeps its connection open
  server->setFault({{"endpoint", "setup.crt"}, {"delay_ms", 120000}});
  auto busy = server->client();
  std::thread request([&] {
    const auto answer = busy->Get("/deviceservices/setup.crt");
    EXPECT_FALSE(answer && answer->status == 200);  // cut by the stop, never answered
  });
  // Wait (bounded) until the delayed request has reached the server.
  bool arrived = false;
  for (int i = 0; i < 5000 && !arrived; ++i) {
    arrived = server->stats().at("requests").at("setup.crt") == 2;
  }
  server->server().stop();
  request.join();
  EXPECT_TRUE(arrived);
  EXPECT_FALSE(idle->Get("/deviceservices/setup.crt"));
}

}  // namespace
}  // namespace devtest
