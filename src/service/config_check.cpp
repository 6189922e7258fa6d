#include "service/config_check.h"

#include <fstream>
#include <sstream>

#include "platform/config/readable_file.h"
#include "tarvexsap/tarvex_sap.h"

namespace {

std::string readAll(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

}  // namespace

std::vector<std::string> startUpProblems(const platform::Configuration& config) {
  std::vector<std::string> problems;
  auto problem = [&](const char* key, const std::filesystem::path& path, const std::string& reason) {
    problems.push_back(config.path.string() + ": " + key + ": " + path.string() + ": " + reason);
  };
  if (auto why = platform::unreadableFileReason(config.trustAnchor)) {
    problem("sap.trust_anchor", config.trustAnchor, *why);
  } else {
    std::string anchor = readAll(config.trustAnchor);
    TarvexSAPConfig sap{reinterpret_cast<const uint8_t*>(anchor.data()), anchor.size(), nullptr};
    if (TarvexSAPConfigure(&sap) != 0) problem("sap.trust_anchor", config.trustAnchor, "is not a PEM certificate");
  }
  // Without this check a missing bundle is found only by the first call, which fails with -5.
  if (!config.caFile.empty()) {
    if (auto why = platform::unreadableFileReason(config.caFile))
      problem("tls.ca_file", config.caFile, *why);
    else if (readAll(config.caFile).find("-----BEGIN CERTIFICATE-----") == std::string::npos)
      problem("tls.ca_file", config.caFile, "holds no PEM certificate");
  }
  if (auto why = platform::unreadableDirectoryReason(config.entitlementsDirectory))
    problem("entitlements.dir", config.entitlementsDirectory, *why);
  return problems;
}

size_t manifestFileCount(const std::filesystem::path& directory) {
  size_t count = 0;
  std::error_code ec;
  for (const auto& item : std::filesystem::directory_iterator(directory, ec))
    if (item.path().extension() == ".json") ++count;
  return count;
}
