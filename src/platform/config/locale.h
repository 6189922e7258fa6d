// Locales by identifier (ICU form: "en_US", "zh_Hans_CN"), and the list of identifiers this
// system knows, taken once from ICU. Identifiers are compared exactly: "en-US" is not "en_US".
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace platform {

class Locale {
 public:
  explicit Locale(std::string identifier) : identifier_(std::move(identifier)) {}
  const std::string& localeIdentifier() const { return identifier_; }
  std::string description() const { return identifier_; }
  friend bool operator==(const Locale&, const Locale&) = default;

 private:
  std::string identifier_;
};

const std::vector<std::string>& availableLocaleIdentifiers();
bool isAvailableLocaleIdentifier(std::string_view identifier);

}  // namespace platform
