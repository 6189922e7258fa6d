#include "request_body.h"

#include <string>

#include "network_test_environment.h"

namespace nettest {

std::optional<nlohmann::json> uploadedBody(const LogCapture& log, size_t from) {
  static const std::string kPrefix = "[#TokenAuth] requestData (string): ";
  const auto entries = log.entries();
  for (size_t i = from; i < entries.size(); ++i) {
    if (!entries[i].message.starts_with(kPrefix)) continue;
    nlohmann::json body = nlohmann::json::parse(entries[i].message.substr(kPrefix.size()), nullptr, false);
    if (body.is_object() && !body.contains("session-request")) return body;
  }
  return std::nullopt;
}

int countParsedAnswers() {
  int n = 0;
  for (const auto& e : environment().log().entries())
    if (e.message.starts_with("[#TokenAuth] responseDict: ") && e.message.find("\"session-info\"") == std::string::npos)
      ++n;
  return n;
}

}  // namespace nettest
