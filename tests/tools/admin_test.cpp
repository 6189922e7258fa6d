// The admin interface: every fault kind, their scoping and lifetime, the statistics, reset,
// and the absence of it all without --admin.
#include <gtest/gtest.h>

#include "devserver/strict_base64.h"
#include "devserver_test_support.h"

namespace devtest {
namespace {

using devserver::DevServerOptions;

class Admin : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(device.associate(*client)); }

  httplib::Result query() {
    return device.post(*client, "queryProductPlan", tokenBody({sampleToken("a")}, "u", "en_US"));
  }
  httplib::Result handshake(Device& other) {
    const auto certificate = client->Get("/deviceservices/setup.crt");
    const Bytes request = other.handshakeRequest(bytesOf(certificate->body));
    const json body = {{"session-request", devserver::base64Encode(request)},
                       {"session-identifier", other.sessionId()}};
    return client->Post("/deviceservices/sapSession", body.dump(), "application/json");
  }

  TestServer server{adminOptions()};
  std::unique_ptr<httplib::SSLClient> client = server.client();
  Device device{server};
};

TEST_F(Admin, StatusFaultKeepsTheBodyAndTheSignature) {
  server.setFault({{"endpoint", "queryProductPlan"}, {"status", 500}});
  const auto answer = query();
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 500);
  EXPECT_EQ(json::parse(answer->body).at("ppid"), "PP-0001-ACCESSORY");
  EXPECT_TRUE(device.verifies(*answer));
  // Other endpoints are untouched.
  const auto ack = device.post(*client, "ackAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(ack);
  EXPECT_EQ(ack->status, 204);
}

TEST_F(Admin, BodyFaultIsSentVerbatimAndSignedAsSent) {
  server.setFault({{"endpoint", "activateAccessory"}, {"body", "{\"tokens\": \"nope\"} trailing"}});
  const auto answer = device.post(*client, "activateAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 200);
  EXPECT_EQ(answer->body, "{\"tokens\": \"nope\"} trailing");
  EXPECT_TRUE(device.verifies(*answer));

  server.setFault({{"endpoint", "activateAccessory"}, {"body", ""}, {"status", 200}});
  const auto empty = device.post(*client, "activateAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->body.empty());
  EXPECT_TRUE(device.verifies(*empty));
}

TEST_F(Admin, SignatureFaults) {
  server.setFault({{"endpoint", "queryProductPlan"}, {"signature", "missing"}});
  auto answer = query();
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 200);
  EXPECT_FALSE(answer->has_header("signature"));

  server.setFault({{"endpoint", "queryProductPlan"}, {"signature", "corrupt"}});
  answer = query();
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 200);
  const auto corrupt = devserver::base64DecodeStrict(answer->get_header_value("signature"));
  ASSERT_TRUE(corrupt);
  EXPECT_EQ(corrupt->size(), 40u);         // well-formed ...
  EXPECT_FALSE(device.verifies(*answer));  // ... but wrong

  // "valid" together with a replaced body and status signs what is sent.
  server.setFault({{"endpoint", "queryProductPlan"}, {"signature", "valid"}, {"status", 503}, {"body", "busy"}});
  answer = query();
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 503);
  EXPECT_TRUE(device.verifies(*answer));

  // An unverified request has no seq to sign with: "corrupt" still sends a well-formed one.
  server.setFault({{"endpoint", "ackAccessory"}, {"signature", "corrupt"}});
  const auto unsigned_ = client->Post("/deviceservices/ackAccessory", "{}", "application/json");
  ASSERT_TRUE(unsigned_);
  EXPECT_EQ(unsigned_->status, 401);
  EXPECT_EQ(devserver::base64DecodeStrict(unsigned_->get_header_value("signature")).value_or(Bytes{}).size(), 40u);
}

TEST_F(Admin, DropClosesTheConnectionWithoutAnAnswer) {
  server.setFault({{"endpoint", "ackAccessory"}, {"drop", true}, {"remaining", 1}});
  const auto dropped = device.post(*client, "ackAccessory", tokenBody({sampleToken("a")}));
  EXPECT_FALSE(dropped);
  // The fault is used up; the client reconnects and the session still works.
  const auto next = device.post(*client, "ackAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(next);
  EXPECT_EQ(next->status, 204);
  const json stats = server.stats();
  EXPECT_EQ(stats.at("requests").at("ackAccessory"), 2);
  EXPECT_EQ(stats.at("statuses").at("204"), 1);
  EXPECT_EQ(stats.at("statuses"), json({{"200", 2}, {"204", 1}}));  // nothing for the drop
}

TEST_F(Admin, DelayStillAnswers) {
  server.setFault({{"endpoint", "*"}, {"delay_ms", 50}, {"remaining", 2}});
  const auto delayed = query();
  ASSERT_TRUE(delayed);
  EXPECT_EQ(delayed->status, 200);
  EXPECT_TRUE(device.verifies(*delayed));
  const auto certificate = client->Get("/deviceservices/setup.crt");
  ASSERT_TRUE(certificate);
  EXPECT_EQ(certificate->status, 200);
  const auto faults = client->Get("/_admin/faults");
  ASSERT_TRUE(faults);
  EXPECT_EQ(json::parse(faults->body).at("faults"), json::array());
}

TEST_F(Admin, SessionAnswerMembersCanBeReplaced) {
  for (const json& validity : {json(true), json("3600"), json(0), json(-5), json(nullptr), json(2.5)}) {
    SCOPED_TRACE(validity.dump());
    server.setFault({{"endpoint", "sapSession"}, {"session_validity", validity}});
    Device other(server, "OTHER");
    const auto answer = handshake(other);
    ASSERT_TRUE(answer);
    ASSERT_EQ(answer->status, 200);
    const json reply = json::parse(answer->body);
    EXPECT_EQ(reply.at("session-validity"), validity);
    // The session info is the real one: the device accepts it.
    const auto info = devserver::base64DecodeStrict(reply.at("session-info").get<std::string>());
    ASSERT_TRUE(info);
    EXPECT_EQ(other.acceptSessionInfo(*info), kTarvexSAPOK);
  }
  server.setFault({{"endpoint", "sapSession"}, {"session_info", "not base64!"}});
  Device other(server, "OTHER");
  const auto answer = handshake(other);
  ASSERT_TRUE(answer);
  ASSERT_EQ(answer->status, 200);
  const json reply = json::parse(answer->body);
  EXPECT_EQ(reply.at("session-info"), "not base64!");
  EXPECT_EQ(reply.at("session-validity"), 3600);
}

TEST_F(Admin, RemainingCountsRequestsAndSpecificRulesBeatTheWildcard) {
  server.setFault({{"endpoint", "*"}, {"status", 502}});
  server.setFault({{"endpoint", "queryProductPlan"}, {"status", 418}, {"remaining", 2}});
  EXPECT_EQ(query()->status, 418);
  EXPECT_EQ(query()->status, 418);
  EXPECT_EQ(query()->status, 502);  // own rule used up: the wildcard applies again
  EXPECT_EQ(client->Get("/deviceservices/setup.crt")->status, 502);

  const auto listed = client->Get("/_admin/faults");
  ASSERT_TRUE(listed);
  EXPECT_EQ(json::parse(listed->body), json({{"faults", {{{"endpoint", "*"}, {"status", 502}}}}}));
  const auto cleared = client->Delete("/_admin/faults");
  ASSERT_TRUE(cleared);
  EXPECT_EQ(cleared->status, 200);
  EXPECT_EQ(query()->status, 200);
}

TEST_F(Admin, InvalidFaultsAre400) {
  const std::vector<std::string> bodies = {
      "not json",
      "[]",
      json{{"status", 500}}.dump(),
      json{{"endpoint", "nowhere"}, {"status", 500}}.dump(),
      json{{"endpoint", "*"}}.dump(),
      json{{"endpoint", "*"}, {"remaining", 3}}.dump(),
      json{{"endpoint", "*"}, {"status", "500"}}.dump(),
      json{{"endpoint", "*"}, {"status", 99}}.dump(),
      json{{"endpoint", "*"}, {"status", 500.5}}.dump(),
      json{{"endpoint", "*"}, {"delay_ms", -1}}.dump(),
      json{{"endpoint", "*"}, {"signature", "broken"}}.dump(),
      json{{"endpoint", "*"}, {"drop", 1}}.dump(),
      json{{"endpoint", "*"}, {"body", 5}}.dump(),
      json{{"endpoint", "*"}, {"session_info", false}}.dump(),
      json{{"endpoint", "*"}, {"status", 500}, {"remaining", 0}}.dump(),
      json{{"endpoint", "*"}, {"status", 500}, {"colour", "red"}}.dump(),
  };
  for (const std::string& body : bodies) {
    SCOPED_TRACE(body);
    const auto answer = client->Post("/_admin/faults", body, "application/json");
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, 400);
    EXPECT_TRUE(json::parse(answer->body).at("error").is_string());
  }
  EXPECT_EQ(json::parse(client->Get("/_admin/faults")->body).at("faults"), json::array());
  // A delay beyond the cap is capped, not refused.
  server.setFault({{"endpoint", "ackAccessory"}, {"delay_ms", 999999999}});
  EXPECT_EQ(json::parse(client->Get("/_admin/faults")->body).at("faults").at(0).at("delay_ms"), 120000);
}

TEST_F(Admin, StatsCountEveryOutcomeAndResetClearsThem) {
  ASSERT_EQ(query()->status, 200);
  ASSERT_EQ(client->Post("/deviceservices/queryProductPlan", "{}", "application/json")->status, 401);
  ASSERT_EQ(client->Get("/nowhere")->status, 404);
  const json stats = server.stats();
  EXPECT_EQ(stats.at("requests"), json({{"setup.crt", 1},
                                        {"sapSession", 1},
                                        {"queryProductPlan", 2},
                                        {"activateAccessory", 0},
                                        {"ackAccessory", 0}}));
  EXPECT_EQ(stats.at("statuses"), json({{"200", 3}, {"401", 1}, {"404", 1}}));
  EXPECT_EQ(stats.at("verified"), 1);
  EXPECT_EQ(stats.at("rejected"), 1);
  EXPECT_EQ(stats.at("handshakes"), 1);
  EXPECT_GE(stats.at("connections"), 1);

  server.setFault({{"endpoint", "*"}, {"status", 500}});
  const auto reset = client->Post("/_admin/reset", "", "application/json");
  ASSERT_TRUE(reset);
  EXPECT_EQ(reset->status, 200);
  const json after = server.stats();
  EXPECT_EQ(after.at("verified"), 0);
  EXPECT_EQ(after.at("statuses"), json::object());
  EXPECT_EQ(query()->status, 200);  // the fault went with the reset
}

TEST_F(Admin, AdminPathsRefuseOtherMethods) {
  EXPECT_EQ(client->Post("/_admin/stats", "", "application/json")->status, 405);
  EXPECT_EQ(client->Get("/_admin/reset")->status, 405);
  EXPECT_EQ(client->Put("/_admin/faults", "", "application/json")->status, 405);
  EXPECT_EQ(client->Get("/_admin/other")->status, 404);
}

TEST(AdminDisabled, AdminPathsAreUnknownWithoutTheOption) {
  TestServer server;
  const auto client = server.client();
  const std::vector<std::function<httplib::Result()>> requests = {
      [&] { return client->Get("/_admin/stats"); },
      [&] { return client->Post("/_admin/faults", "{}", "application/json"); },
      [&] { return client->Delete("/_admin/faults"); },
      [&] { return client->Post("/_admin/reset", "", "text/plain"); },
  };
  for (const auto& request : requests) {
    const auto answer = request();
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, 404);
    EXPECT_EQ(json::parse(answer->body).at("error"), "no such endpoint");
  }
}

}  // namespace
}  // namespace devtest
