// Faults that the admin interface sets on endpoints, to test clients against a misbehaving
// server. A rule is the JSON body of POST /_admin/faults:
//   {"endpoint": "setup.crt"|"sapSession"|"queryProductPlan"|"activateAccessory"|"ackAccessory"|"*",
//    "status": 200..599, "delay_ms": >= 0 (capped at 120000), "body": string,
//    "signature": "valid"|"missing"|"corrupt"|"padded", "drop": bool, "session_validity": any JSON value,
//    "session_info": string, "remaining": >= 1 (absent: every request)}
// with at least one fault member. One rule per endpoint (a new one replaces the old); "*" covers
// the endpoints without a rule of their own. Thread-safe.
#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>

#include "devserver/endpoint.h"
#include "platform/values/result.h"

namespace devserver {

// padded: a valid signature with spaces and a tab around it (optional white space, not part of it).
enum class SignatureFault { valid, missing, corrupt, padded };

struct Fault {
  std::optional<int> status;
  std::chrono::milliseconds delay{0};
  std::optional<std::string> body;
  std::optional<SignatureFault> signature;
  bool drop = false;
  std::optional<nlohmann::json> sessionValidity;
  std::optional<std::string> sessionInfo;
  std::optional<int64_t> remaining;  // requests left; nullopt: unlimited
};

struct FaultRule {
  std::optional<Endpoint> endpoint;  // nullopt: "*"
  Fault fault;
};

inline constexpr std::chrono::milliseconds kLongestFaultDelay{120000};

// parseFaultRule returns the rule `document` describes, or a failure naming the member that is
// wrong (the text the admin interface answers with).
platform::Result<FaultRule> parseFaultRule(const nlohmann::json& document);
nlohmann::json faultRuleToJSON(const FaultRule& rule);

class FaultTable {
 public:
  void set(FaultRule rule);
  void clear();
  // The fault for the next request of `endpoint`, used up once its `remaining` reaches 0.
  std::optional<Fault> take(Endpoint endpoint);
  // The rules in force, as an array of rule objects.
  nlohmann::json toJSON() const;

 private:
  mutable std::mutex mutex_;
  std::array<std::optional<Fault>, kAllEndpoints.size()> byEndpoint_;  // guarded by mutex_
  std::optional<Fault> everyEndpoint_;                                 // guarded by mutex_
};

}  // namespace devserver
