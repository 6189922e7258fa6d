// The shared ZLKANetwork in the reference-server world (common/server_world.h), called as a client
// would: from a thread serving a peer's message, with every line the process logs captured.
// NetworkTest resets the server, the settings suite, the log and the session before every test.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>

#include "common/log_capture.h"
#include "common/server_world.h"
#include "network/zlka_network.h"
#include "platform/connection.h"
#include "support/errors.h"

namespace nettest {

using nlohmann::json;
using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;

inline constexpr std::chrono::seconds kReplyGuard{90};  // a hang guard only
inline constexpr char kUUID[] = "3F2504E0-4F89-11D3-9A0C-0305E82C3301";

// The capture every network test reads, installed on first use for the rest of the process.
zlkatest::LogCapture& log();
inline zlkatest::ServerWorld& world() { return zlkatest::ServerWorld::get(); }

// A peer whose "com.kestro.ZLKAuthentication" entitlement has this value (nullopt: none).
std::unique_ptr<platform::Connection> peer(std::optional<Value> entitlement = Value(platform::Array{Value("token-auth")}));
// One DER item (content below 64 KiB), and a token as an accessory carries it.
Data derItem(uint8_t tag, std::string_view content);
Data sampleToken(std::string_view label = "accessory-token");

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
  bool hasValues = false;            // the reply carried the operation's values (confirmation: none expected)
  int replies = 0;                   // reply calls up to the moment every queue that could reply had drained
  size_t logStart = 0, logMark = 0;  // the call's log entries up to its first reply
};

// Starts the operation on this thread, as whatever connection is current; `reply` gets each
// reply call.
void start(const Call& call, std::function<void(Outcome)> reply);
// Runs it as `caller` (an entitled peer when null) and waits for its reply.
Outcome run(const Call& call = {}, platform::Connection* caller = nullptr);
// A failure: one reply, no values, the service's error for `code`, and its fault line before the
// reply.
void expectFailure(const Outcome& outcome, int64_t code);
// A line starting with `prefix` was logged at `level`, at or after entry `from`.
void expectLine(LogLevel level, const std::string& prefix, size_t from = 0);
// The body of the first token request logged at or after `from` (tests log private data).
std::optional<json> uploadedBody(size_t from = 0);

class NetworkTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  static std::shared_ptr<ZLKANetwork> network() { return ZLKANetwork::sharedInstance(); }
  // Gives the network a new closed session over these primitives.
  static std::shared_ptr<TarvexSAPSession> installSession(TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library());
  static const zlkatest::AdminClient& admin() { return world().admin(); }
  static const zlkatest::SettingsSuite& suite() { return world().suite(); }
};

}  // namespace nettest
