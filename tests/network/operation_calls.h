// Calling the three token operations as a client would: from a thread serving a peer's message
// (a current connection whose peer holds, or lacks, the entitlement), waiting for the reply and
// counting how often the reply was called. Waits are hang guards only.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "network/zlka_network.h"
#include "platform/connection.h"
#include "platform/data.h"
#include "platform/error.h"
#include "platform/locale.h"
#include "platform/value.h"

namespace nettest {

inline constexpr std::chrono::seconds kReplyGuard{90};

// A peer whose "com.kestro.ZLKAuthentication" entitlement has this value (nullopt: none).
std::unique_ptr<platform::Connection> peerWithEntitlement(std::optional<platform::Value> value);
// A peer holding the "token-auth" category.
std::unique_ptr<platform::Connection> entitledPeer();

// One DER item: identifier octet, minimal definite length, content (below 64 KiB).
platform::Data derItem(uint8_t tag, std::string_view content);
// A token as an accessory carries it: one SEQUENCE { OCTET STRING label }.
platform::Data sampleToken(std::string_view label = "accessory-token");
platform::Data concat(const std::vector<platform::Data>& pieces);

inline constexpr char kSampleUUID[] = "3F2504E0-4F89-11D3-9A0C-0305E82C3301";

struct MetadataCall {
  std::optional<platform::Data> token = sampleToken();
  std::optional<std::string> uuid = std::string(kSampleUUID);
  std::optional<platform::Locale> locale = platform::Locale("en_US");
  std::optional<platform::Dictionary> requestInfo;

  MetadataCall& withToken(std::optional<platform::Data> v) {
    token = std::move(v);
    return *this;
  }
  MetadataCall& withUUID(std::optional<std::string> v) {
    uuid = std::move(v);
    return *this;
  }
  MetadataCall& withLocale(std::optional<std::string> identifier) {
    locale = identifier ? std::optional(platform::Locale(*identifier)) : std::nullopt;
    return *this;
  }
  MetadataCall& withRequestInfo(std::optional<platform::Dictionary> v) {
    requestInfo = std::move(v);
    return *this;
  }
};

struct TokenCall {
  std::optional<platform::Data> token = sampleToken();
  std::optional<std::string> uuid = std::string(kSampleUUID);

  TokenCall& withToken(std::optional<platform::Data> v) {
    token = std::move(v);
    return *this;
  }
  TokenCall& withUUID(std::optional<std::string> v) {
    uuid = std::move(v);
    return *this;
  }
};

// What came back. `replies` counts the reply calls up to the moment every queue that could still
// reply had drained; the log entries of the call up to its first reply are [logStart, logMark).
struct MetadataOutcome {
  std::optional<std::string> ppid;
  std::optional<platform::Locale> locale;
  std::optional<platform::Dictionary> metadata;
  std::optional<platform::Error> error;
  int replies = 0;
  size_t logStart = 0;
  size_t logMark = 0;
};

struct ActivationOutcome {
  std::optional<platform::Data> newToken;
  std::optional<platform::Error> error;
  int replies = 0;
  size_t logStart = 0;
  size_t logMark = 0;
};

struct ConfirmationOutcome {
  std::optional<platform::Error> error;
  int replies = 0;
  size_t logStart = 0;
  size_t logMark = 0;
};

// Each runs the operation on the calling thread with `caller` current (the entitled peer when
// null) and waits for its reply.
MetadataOutcome requestMetadata(const MetadataCall& call = {}, platform::Connection* caller = nullptr);
ActivationOutcome requestActivation(const TokenCall& call = {}, platform::Connection* caller = nullptr);
ConfirmationOutcome confirmActivation(const TokenCall& call = {}, platform::Connection* caller = nullptr);

// Lets the HTTP session's callback queue run everything already queued on it.
void drainReplies();

// The service's error for this code: its domain, the code and the code's fixed message.
void expectServiceError(const std::optional<platform::Error>& error, int64_t code);
// The fault-level "[#TokenAuth] error: ..." line of this code was logged in [from, to).
void expectErrorLineBetween(size_t from, size_t to, int64_t code);

// A line starting with `prefix` was logged at `level` at or after log entry `from`.
void expectLine(platform::LogLevel level, const std::string& prefix, size_t from = 0);

// A failure reply: exactly one reply, no values, this code, and the error line before it.
void expectFailure(const MetadataOutcome& outcome, int64_t code);
void expectFailure(const ActivationOutcome& outcome, int64_t code);
void expectFailure(const ConfirmationOutcome& outcome, int64_t code);

}  // namespace nettest
