// The setup certificate and the handshake endpoint, driven by the device-side primitives.
#include <gtest/gtest.h>

#include "devserver/strict_base64.h"
#include "devserver_test_support.h"

namespace devtest {
namespace {

using devserver::base64Encode;
using devserver::DevServerOptions;

TEST(DevServerHandshake, SetupCertificateIsServedAsDER) {
  TestServer server;
  const auto client = server.client();
  const auto answer = client->Get("/deviceservices/setup.crt");
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 200);
  EXPECT_EQ(answer->get_header_value("Content-Type"), "application/pkix-cert");
  EXPECT_EQ(answer->body, readText(server.stateDir() / "setup.crt"));
  EXPECT_EQ(answer->body.front(), '\x30');  // DER, not PEM
}

TEST(DevServerHandshake, DeviceCompletesAnAssociationAndTheAnswerAnnouncesTheValidity) {
  TestServer server(validityOptions(std::chrono::seconds(1234)));
  const auto client = server.client();
  Device device(server);
  const auto certificate = client->Get("/deviceservices/setup.crt");
  ASSERT_TRUE(certificate);
  const Bytes request = device.handshakeRequest(bytesOf(certificate->body));
  ASSERT_EQ(request.size(), 90u);

  const json body = {{"session-request", base64Encode(request)}, {"session-identifier", kSessionId}};
  const auto answer = client->Post("/deviceservices/sapSession", body.dump(), "application/json");
  ASSERT_TRUE(answer);
  ASSERT_EQ(answer->status, 200) << answer->body;
  const json reply = json::parse(answer->body);
  ASSERT_TRUE(reply.at("session-validity").is_number_integer());
  EXPECT_EQ(reply.at("session-validity").get<int64_t>(), 1234);
  const auto info = devserver::base64DecodeStrict(reply.at("session-info").get<std::string>());
  ASSERT_TRUE(info);
  EXPECT_EQ(info->size(), 129u);
  EXPECT_EQ(device.acceptSessionInfo(*info), kTarvexSAPOK);

  // The association works for a signed request straight away.
  const auto signedAnswer = device.post(*client, "ackAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(signedAnswer);
  EXPECT_EQ(signedAnswer->status, 204);
  EXPECT_EQ(server.stats().at("handshakes"), 1);
}

TEST(DevServerHandshake, MalformedHandshakesAre400WithAJSONError) {
  TestServer server(adminOptions());
  const auto client = server.client();
  Device device(server);
  const auto certificate = client->Get("/deviceservices/setup.crt");
  ASSERT_TRUE(certificate);
  const Bytes good = device.handshakeRequest(bytesOf(certificate->body));
  Bytes badMagic = good;
  badMagic[0] = 'X';
  Bytes badPadding = good;
  badPadding[5] = 2;   // two identifier bytes announced ...
  badPadding[25] = 1;  // ... and a non-zero byte in the padding
  const Bytes truncated(good.begin(), good.end() - 1);

  // Where the base64 is the fault, the request would be well-formed if decoded leniently.
  const std::vector<std::pair<const char*, std::string>> cases = {
      {"not JSON", "{\"session-request\":"},
      {"not an object", "[1,2]"},
      {"request missing", json{{"session-identifier", kSessionId}}.dump()},
      {"identifier missing", json{{"session-request", base64Encode(good)}}.dump()},
      {"request not a string", json{{"session-request", 7}, {"session-identifier", kSessionId}}.dump()},
      {"identifier not a string", json{{"session-request", base64Encode(good)}, {"session-identifier", 1}}.dump()},
      {"request not base64", json{{"session-request", "@@@@"}, {"session-identifier", kSessionId}}.dump()},
      {"base64 with a line break",
       json{{"session-request", base64Encode(good).insert(4, "\n")}, {"session-identifier", kSessionId}}.dump()},
      {"base64 with a trailing space",
       json{{"session-request", base64Encode(good) + " "}, {"session-identifier", kSessionId}}.dump()},
      {"short request", json{{"session-request", base64Encode(truncated)}, {"session-identifier", kSessionId}}.dump()},
      {"bad magic", json{{"session-request", base64Encode(badMagic)}, {"session-identifier", kSessionId}}.dump()},
      {"bad padding", json{{"session-request", base64Encode(badPadding)}, {"session-identifier", kSessionId}}.dump()},
      {"empty identifier", json{{"session-request", base64Encode(good)}, {"session-identifier", ""}}.dump()},
  };
  for (const auto& [what, body] : cases) {
    SCOPED_TRACE(what);
    const auto answer = client->Post("/deviceservices/sapSession", body, "application/json");
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, 400);
    const json error = json::parse(answer->body, nullptr, false);
    ASSERT_TRUE(error.is_object()) << answer->body;
    ASSERT_TRUE(error.at("error").is_string());
    if (std::string_view(what).starts_with("base64")) {
      EXPECT_EQ(error.at("error"), "\"session-request\" is not base64");
    }
  }
  EXPECT_EQ(server.stats().at("handshakes"), 0);
}

TEST(DevServerHandshake, NewHandshakeUnderTheSameIdentifierReplacesTheAssociation) {
  TestServer server;
  const auto client = server.client();
  Device first(server);
  ASSERT_TRUE(first.associate(*client));
  Device second(server);  // same session identifier
  ASSERT_TRUE(second.associate(*client));

  const std::string body = tokenBody({sampleToken("a")});
  const auto stale = first.post(*client, "ackAccessory", body);
  ASSERT_TRUE(stale);
  EXPECT_EQ(stale->status, 401);
  const auto current = second.post(*client, "ackAccessory", body);
  ASSERT_TRUE(current);
  EXPECT_EQ(current->status, 204);
}

TEST(DevServerHandshake, ExpiredSessionIsRefused) {
  // A validity of 0 expires the association as soon as it is made.
  TestServer server(validityOptions(std::chrono::seconds(0)));
  const auto client = server.client();
  Device device(server);
  ASSERT_TRUE(device.associate(*client));
  const auto answer = device.post(*client, "ackAccessory", tokenBody({sampleToken("a")}));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 401);
  EXPECT_EQ(json::parse(answer->body).at("error"), "session expired");
  EXPECT_FALSE(answer->has_header("signature"));
}

}  // namespace
}  // namespace devtest
