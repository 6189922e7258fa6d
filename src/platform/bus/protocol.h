// A small runtime description of interfaces and classes: which methods a protocol lists (required
// or optional, instance or class) and which methods a class's instances and the class itself answer.
// The messaging layer builds its exported interfaces from it.
#pragma once

#include <set>
#include <string>
#include <vector>

namespace platform {

struct MethodDescription {
  std::string name;
  bool required = true;
  bool instanceMethod = true;
};

struct Protocol {
  std::string name;
  std::vector<MethodDescription> methods;
};

struct ClassDescription {
  std::string name;
  std::set<std::string, std::less<>> instanceMethods;
  std::set<std::string, std::less<>> classMethods;

  // instancesRespondToSelector is true when `method` is one of the instance methods.
  bool instancesRespondToSelector(const std::string& method) const { return instanceMethods.count(method) != 0; }
};

}  // namespace platform
