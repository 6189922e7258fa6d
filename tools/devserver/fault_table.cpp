#include "devserver/fault_table.h"

#include <algorithm>

namespace devserver {

using nlohmann::json;

namespace {

using platform::Done;
using platform::Failure;
using platform::Result;

Failure invalid(const std::string& member, const std::string& what) { return Failure{"\"" + member + "\" " + what}; }

Result<int64_t> integerMember(const json& value, const std::string& member, int64_t low, int64_t high) {
  if (!value.is_number_integer()) {
    return invalid(member, "must be an integer");
  }
  // Unsigned values above INT64_MAX would wrap: judge them before converting.
  if (value.is_number_unsigned() && value.get<uint64_t>() > static_cast<uint64_t>(high)) {
    return invalid(member, "must be at most " + std::to_string(high));
  }
  const auto number = value.get<int64_t>();
  if (number < low || number > high) {
    return invalid(member, "must be between " + std::to_string(low) + " and " + std::to_string(high));
  }
  return number;
}

std::size_t slot(Endpoint endpoint) { return static_cast<std::size_t>(endpoint); }

const char* signatureName(SignatureFault mode) {
  switch (mode) {
    case SignatureFault::valid:
      return "valid";
    case SignatureFault::missing:
      return "missing";
    case SignatureFault::corrupt:
      return "corrupt";
    case SignatureFault::padded:
      return "padded";
  }
  return "";
}

Result<SignatureFault> signatureMember(const json& value, const std::string& member) {
  const std::string mode = value.is_string() ? value.get<std::string>() : "";
  for (SignatureFault known :
       {SignatureFault::valid, SignatureFault::missing, SignatureFault::corrupt, SignatureFault::padded}) {
    if (mode == signatureName(known)) {
      return known;
    }
  }
  return invalid(member, "must be \"valid\", \"missing\", \"corrupt\" or \"padded\"");
}

Result<std::string> stringMember(const json& value, const std::string& member) {
  if (!value.is_string()) {
    return invalid(member, "must be a string");
  }
  return value.get<std::string>();
}

// nullopt for "*", every endpoint.
Result<std::optional<Endpoint>> endpointMember(const json& value, const std::string& member) {
  const Result<std::string> name = stringMember(value, member);
  if (!name) {
    return Failure{name.error()};
  }
  if (*name == "*") {
    return std::optional<Endpoint>();
  }
  std::optional<Endpoint> endpoint = endpointNamed(*name);
  if (!endpoint) {
    return invalid(member,
                   "must be \"setup.crt\", \"sapSession\", \"queryProductPlan\", "
                   "\"activateAccessory\", \"ackAccessory\" or \"*\"");
  }
  return endpoint;
}

// Stores a member's value in `slot` when it parsed; the failure otherwise.
template <typename T, typename Slot>
Done store(Result<T> parsed, Slot& slot) {
  if (!parsed) {
    return Failure{parsed.error()};
  }
  slot = *std::move(parsed);
  return std::nullopt;
}

// The members that describe a fault, each with the parser that stores it (nullopt) or says why not.
struct FaultMember {
  const char* name;
  Done (*parse)(const json& value, const std::string& member, Fault& fault);
};

const FaultMember kFaultMembers[] = {
    {"status",
     [](const json& value, const std::string& member, Fault& fault) -> Done {
       const Result<int64_t> status = integerMember(value, member, 200, 599);
       if (!status) {
         return Failure{status.error()};
       }
       fault.status = static_cast<int>(*status);
       return std::nullopt;
     }},
    {"delay_ms",
     [](const json& value, const std::string& member, Fault& fault) -> Done {
       const Result<int64_t> ms = integerMember(value, member, 0, INT64_MAX);
       if (!ms) {
         return Failure{ms.error()};
       }
       fault.delay = std::min(std::chrono::milliseconds(*ms), kLongestFaultDelay);
       return std::nullopt;
     }},
    {"body", [](const json& value, const std::string& member,
                Fault& fault) { return store(stringMember(value, member), fault.body); }},
    {"signature", [](const json& value, const std::string& member,
                     Fault& fault) { return store(signatureMember(value, member), fault.signature); }},
    {"drop",
     [](const json& value, const std::string& member, Fault& fault) -> Done {
       if (!value.is_boolean()) {
         return invalid(member, "must be true or false");
       }
       fault.drop = value.get<bool>();
       return std::nullopt;
     }},
    {"session_validity",
     [](const json& value, const std::string&, Fault& fault) -> Done {
       fault.sessionValidity = value;
       return std::nullopt;
     }},
    {"session_info", [](const json& value, const std::string& member,
                        Fault& fault) { return store(stringMember(value, member), fault.sessionInfo); }},
};

const FaultMember* faultMemberNamed(const std::string& name) {
  for (const FaultMember& known : kFaultMembers) {
    if (name == known.name) {
      return &known;
    }
  }
  return nullptr;
}

}  // namespace

Result<FaultRule> parseFaultRule(const json& document) {
  if (!document.is_object()) {
    return Failure{"a fault must be a JSON object"};
  }
  FaultRule rule;
  bool endpointGiven = false;
  bool faultGiven = false;
  for (const auto& [member, value] : document.items()) {
    Done failed;
    if (member == "endpoint") {
      failed = store(endpointMember(value, member), rule.endpoint);
      endpointGiven = true;
    } else if (member == "remaining") {
      failed = store(integerMember(value, member, 1, INT64_MAX), rule.fault.remaining);
    } else if (const FaultMember* known = faultMemberNamed(member)) {
      failed = known->parse(value, member, rule.fault);
      faultGiven = true;
    } else {
      failed = Failure{"unknown member \"" + member + "\""};
    }
    if (failed) {
      return std::move(*failed);
    }
  }
  if (!endpointGiven) {
    return invalid("endpoint", "is required");
  }
  if (!faultGiven) {
    return Failure{
        "no fault given: set at least one of \"status\", \"delay_ms\", \"body\", "
        "\"signature\", \"drop\", \"session_validity\", \"session_info\""};
  }
  return rule;
}

json faultRuleToJSON(const FaultRule& rule) {
  const Fault& fault = rule.fault;
  json out = json::object();
  out["endpoint"] = rule.endpoint ? std::string(endpointName(*rule.endpoint)) : "*";
  if (fault.status) {
    out["status"] = *fault.status;
  }
  if (fault.delay.count() > 0) {
    out["delay_ms"] = fault.delay.count();
  }
  if (fault.body) {
    out["body"] = *fault.body;
  }
  if (fault.signature) {
    out["signature"] = signatureName(*fault.signature);
  }
  if (fault.drop) {
    out["drop"] = true;
  }
  if (fault.sessionValidity) {
    out["session_validity"] = *fault.sessionValidity;
  }
  if (fault.sessionInfo) {
    out["session_info"] = *fault.sessionInfo;
  }
  if (fault.remaining) {
    out["remaining"] = *fault.remaining;
  }
  return out;
}

void FaultTable::set(FaultRule rule) {
  std::lock_guard lock(mutex_);
  (rule.endpoint ? byEndpoint_[slot(*rule.endpoint)] : everyEndpoint_) = std::move(rule.fault);
}

void FaultTable::clear() {
  std::lock_guard lock(mutex_);
  byEndpoint_.fill(std::nullopt);
  everyEndpoint_.reset();
}

std::optional<Fault> FaultTable::take(Endpoint endpoint) {
  std::lock_guard lock(mutex_);
  std::optional<Fault>& entry = byEndpoint_[slot(endpoint)] ? byEndpoint_[slot(endpoint)] : everyEndpoint_;
  if (!entry) {
    return std::nullopt;
  }
  Fault fault = *entry;
  if (entry->remaining && --*entry->remaining == 0) {
    entry.reset();
  }
  return fault;
}

json FaultTable::toJSON() const {
  std::lock_guard lock(mutex_);
  json out = json::array();
  for (const Endpoint endpoint : kAllEndpoints) {
    if (const auto& fault = byEndpoint_[slot(endpoint)]) {
      out.push_back(faultRuleToJSON(FaultRule{endpoint, *fault}));
    }
  }
  if (everyEndpoint_) {
    out.push_back(faultRuleToJSON(FaultRule{std::nullopt, *everyEndpoint_}));
  }
  return out;
}

}  // namespace devserver
