// Locales by identifier (ICU form: "en_US", "zh_Hans_CN"), and the list of identifiers this
// system knows, taken once from ICU. Identifiers are compared exactly: "en-US" is not "en_US".
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace platform {

class Locale {
 public:
  // Locale names `identifier` as given: it is not checked against the available list.
  explicit Locale(std::string identifier) : identifier_(std::move(identifier)) {}
  // The identifier as given, borrowed from the locale; description() copies it for log lines.
  const std::string& localeIdentifier() const { return identifier_; }
  std::string description() const { return identifier_; }
  friend bool operator==(const Locale&, const Locale&) = default;

 private:
  std::string identifier_;
};

// availableLocaleIdentifiers is ICU's list, read on first use; it lives as long as the process.
const std::vector<std::string>& availableLocaleIdentifiers();
// isAvailableLocaleIdentifier is true when `identifier` is exactly one of that list.
bool isAvailableLocaleIdentifier(std::string_view identifier);

}  // namespace platform
