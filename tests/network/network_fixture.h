// The shared ZLKANetwork in the reference-server world (common/server_world.h), called as a client
// would: from a thread serving a peer's message, with every line the process logs captured.
// NetworkTest resets the server, the settings suite, the log and the session before every test.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>

#include "common/log_capture.h"
#include "common/rows.h"
#include "common/server_world.h"
#include "network/zlka_network.h"
#include "network/zlka_network_constants.h"
#include "platform/dispatch/semaphore.h"
#include "platform/listener/connection.h"
#include "support/errors.h"

namespace nettest {

using nlohmann::json;
using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;

inline constexpr std::chrono::seconds kReplyGuard{90};  // a hang guard only
inline constexpr char kUUID[] = "3F2504E0-4F89-11D3-9A0C-0305E82C3301";

// Installed before anything logs and never destroyed: the shared instance logs at exit.
inline zlkatest::LogCapture& log() {
  static auto* capture = new zlkatest::LogCapture;
  return *capture;
}
[[maybe_unused]] inline const zlkatest::LogCapture& kInstalled = log();
inline zlkatest::ServerWorld& world() { return zlkatest::ServerWorld::get(); }
inline const zlkatest::AdminClient& admin() { return world().admin(); }
inline platform::SettingsStore& suite() { return world().suite(); }
inline std::shared_ptr<ZLKANetwork> network() { return ZLKANetwork::sharedInstance(); }

// A peer whose "com.kestro.ZLKAuthentication" entitlement has this value (nullopt: none).
inline std::unique_ptr<platform::Connection> peer(std::optional<Value> entitlement = Value(platform::Array{
                                                      Value("token-auth")})) {
  return std::make_unique<platform::Connection>(
      ":1.test", [entitlement](std::string_view name) { return name == ZLKAEntitlement ? entitlement : std::nullopt; });
}

// A token as an accessory carries it: a DER SEQUENCE around an OCTET STRING (label below 126 bytes).
inline Data sampleToken(std::string_view label = "accessory-token") {
  return Data::fromString(
      std::string{'\x30', static_cast<char>(label.size() + 2), '\x04', static_cast<char>(label.size())} +
      std::string(label));
}

enum class Op { metadata, activation, confirmation };

struct Call {
  Op op = Op::metadata;
  std::optional<Data> token = sampleToken();
  std::optional<std::string> uuid = kUUID;
  std::optional<std::string> locale = "en_US";  // the metadata query's alone, like requestInfo
  std::optional<platform::Dictionary> requestInfo = std::nullopt;
};

struct Outcome {
  std::optional<std::string> ppid = std::nullopt;
  std::optional<platform::Locale> locale = std::nullopt;
  std::optional<platform::Dictionary> metadata = std::nullopt;
  std::optional<Data> newToken = std::nullopt;
  std::optional<Error> error = std::nullopt;
  bool hasValues = false;            // the reply carried the operation's values
  int replies = 0;                   // up to the moment every queue that could reply had drained
  size_t logStart = 0, logMark = 0;  // the call's log entries up to its first reply
};

// Starts the operation on this thread, as whatever connection is current.
inline void start(const Call& call, std::function<void(Outcome)> reply) {
  if (call.op == Op::activation)
    return network()->requestActivationForToken(call.token, call.uuid, [reply](auto newToken, auto error) {
      reply({.newToken = newToken, .error = error, .hasValues = newToken.has_value()});
    });
  if (call.op == Op::confirmation)
    return network()->confirmActivationForToken(call.token, call.uuid,
                                                [reply](auto error) { reply({.error = error}); });
  std::optional<platform::Locale> locale;
  if (call.locale) locale.emplace(*call.locale);
  network()->requestMetadataForToken(call.token, call.uuid, locale, call.requestInfo,
                                     [reply](auto ppid, auto locale, auto metadata, auto error) {
                                       reply({.ppid = ppid,
                                              .locale = locale,
                                              .metadata = metadata,
                                              .error = error,
                                              .hasValues = ppid || locale || metadata});
                                     });
}

// Runs it as `caller` (an entitled peer when null) and waits for its reply.
inline Outcome run(const Call& call = {}, platform::Connection* caller = nullptr) {
  struct Box {
    std::mutex mutex;
    Outcome outcome;
    platform::Semaphore first;
  };
  auto box = std::make_shared<Box>();
  box->outcome.logStart = log().size();
  {
    std::unique_ptr<platform::Connection> entitled = caller ? nullptr : peer();
    platform::Connection::CurrentScope scope(caller ? caller : entitled.get());
    start(call, [box](Outcome got) {
      std::lock_guard lock(box->mutex);
      if (box->outcome.replies++ > 0) return;
      got.replies = 1;
      got.logStart = box->outcome.logStart;
      got.logMark = log().size();
      box->outcome = std::move(got);
      box->first.signal();
    });
  }
  if (!box->first.waitFor(kReplyGuard)) ADD_FAILURE() << "no reply";
  network()->urlSession()->callbackQueue()->sync([] {});  // where a second reply would come from
  std::lock_guard lock(box->mutex);
  return box->outcome;
}

// A line starting with `prefix` was logged at `level`, at or after entry `from`.
inline void expectLine(LogLevel level, const std::string& prefix, size_t from = 0) {
  EXPECT_GT(log().countStartingWith(prefix, from, level), 0) << platform::logLevelName(level) << " " << prefix << "\n"
                                                             << log().dump();
}

// A failure: one reply, no values, the service's error for `code`, and its fault line before the reply.
inline void expectFailure(const Outcome& outcome, int64_t code) {
  EXPECT_EQ(outcome.replies, 1);
  EXPECT_FALSE(outcome.hasValues);
  ASSERT_TRUE(outcome.error) << "expected error " << code << "\n" << log().dump();
  EXPECT_EQ(*outcome.error, ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, code)) << outcome.error->description();
  const std::string line = "[#TokenAuth] error: " + outcome.error->description();
  EXPECT_EQ(log().count(LogLevel::Fault, line, outcome.logStart, outcome.logMark), 1)
      << "not logged before the reply: " << line;
}

// The body of the first token request logged at or after `from` (tests log private data).
inline std::optional<json> uploadedBody(size_t from = 0) {
  const std::string prefix = "[#TokenAuth] requestData (string): ";
  for (const auto& e : log().entries(from)) {
    json body = json::parse(e.message.starts_with(prefix) ? e.message.substr(prefix.size()) : "", nullptr, false);
    if (body.is_object() && !body.contains("session-request")) return body;  // not the handshake's
  }
  return std::nullopt;
}

class NetworkTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NO_FATAL_FAILURE(admin().reset());
    std::filesystem::remove(suite().filePath());
    installSession();
    log().clear();
  }
  void TearDown() override {
    admin().clearFaults();
    std::filesystem::remove(suite().filePath());
  }
  // Gives the network a new closed session over these primitives.
  static void installSession(TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library()) {
    network()->setTarvexSAPSession(TarvexSAPSession::sessionWithDelegate(network(), std::move(primitives)));
  }
};

}  // namespace nettest
