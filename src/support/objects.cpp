#include "support/objects.h"

bool isNSObjectNull(const std::optional<platform::Value>& object) { return !object || object->isNull(); }

std::optional<platform::Value> NSObjectIfNotNull(const std::optional<platform::Value>& object) {
  if (isNSObjectNull(object)) return std::nullopt;
  return object;
}

bool isNSObjectEqual(const std::optional<platform::Value>& a, const std::optional<platform::Value>& b) {
  if (!a && !b) return true;
  if (!a || !b) return false;
  return *a == *b;
}

bool classImplementsMethodsInProtocol(const platform::ClassDescription& cls, const platform::Protocol& protocol,
                                      bool required, bool instanceMethods, std::set<std::string>* missing) {
  std::set<std::string> absent;
  for (const platform::MethodDescription& m : protocol.methods) {
    if (m.required != required || m.instanceMethod != instanceMethods) continue;
    if (!cls.instancesRespondToSelector(m.name)) absent.insert(m.name);
  }
  bool complete = absent.empty();
  if (missing) *missing = std::move(absent);
  return complete;
}
