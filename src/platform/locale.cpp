#include "platform/locale.h"

#include <unicode/uloc.h>

#include <algorithm>

namespace platform {

namespace {
struct Identifiers {
  std::vector<std::string> list;
  std::vector<std::string> sorted;
  Identifiers() {
    int32_t n = uloc_countAvailable();
    for (int32_t i = 0; i < n; ++i)
      if (const char* id = uloc_getAvailable(i)) list.emplace_back(id);
    sorted = list;
    std::sort(sorted.begin(), sorted.end());
  }
};

const Identifiers& identifiers() {
  static const Identifiers ids;
  return ids;
}
}  // namespace

const std::vector<std::string>& availableLocaleIdentifiers() { return identifiers().list; }

bool isAvailableLocaleIdentifier(std::string_view identifier) {
  const auto& sorted = identifiers().sorted;
  return std::binary_search(sorted.begin(), sorted.end(), identifier);
}

}  // namespace platform
