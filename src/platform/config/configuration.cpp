#include "platform/config/configuration.h"

#include <curl/curl.h>
#include <toml++/toml.h>

#include <memory>
#include <mutex>

#include "platform/config/readable_file.h"
#include "platform/values/result.h"

namespace platform {

namespace {

struct CurlURLFree {
  void operator()(CURLU* u) const { curl_url_cleanup(u); }
};
struct CurlStringFree {
  void operator()(char* s) const { curl_free(s); }
};

std::string part(CURLU* url, CURLUPart which) {
  char* raw = nullptr;
  if (curl_url_get(url, which, &raw, 0) != CURLUE_OK || !raw) return {};
  std::unique_ptr<char, CurlStringFree> owned(raw);
  return raw;
}

class Reader {
 public:
  Reader(const toml::table& root, std::string file) : root_(root), file_(std::move(file)) {}

  bool fail(const std::string& key, const std::string& problem) {
    if (error_.empty()) error_ = file_ + ": " + key + ": " + problem;
    return false;
  }
  const std::string& error() const { return error_; }

  const toml::node* node(std::string_view key) { return root_.at_path(key).node(); }

  bool boolean(std::string_view key, bool& out, bool required) {
    const toml::node* n = node(key);
    if (!n) return !required || fail(std::string(key), "missing (expected true or false)");
    if (!n->is_boolean()) return fail(std::string(key), "expected true or false");
    out = n->as_boolean()->get();
    return true;
  }

  bool string(std::string_view key, std::string& out, bool required) {
    const toml::node* n = node(key);
    if (!n) return !required || fail(std::string(key), "missing (expected a string)");
    if (!n->is_string()) return fail(std::string(key), "expected a string");
    out = n->as_string()->get();
    return true;
  }

  bool count(std::string_view key, unsigned& out, int64_t lowest, int64_t highest) {
    const toml::node* n = node(key);
    if (!n) return true;
    const toml::value<int64_t>* v = n->as_integer();
    if (!v || v->get() < lowest || v->get() > highest)
      return fail(std::string(key),
                  "expected a whole number from " + std::to_string(lowest) + " to " + std::to_string(highest));
    out = static_cast<unsigned>(v->get());
    return true;
  }

  bool url(std::string_view key, std::string& out) {
    std::string raw;
    if (!string(key, raw, true)) return false;
    auto normalized = normalizedBaseURL(raw);
    if (!normalized) return fail(std::string(key), "'" + raw + "' is not an absolute https base URL");
    out = *normalized;
    return true;
  }

 private:
  const toml::table& root_;
  std::string file_;
  std::string error_;
};

void collectUnknownKeys(const toml::table& table, const std::string& prefix, std::vector<std::string>& unknown) {
  static const std::map<std::string, std::vector<std::string>, std::less<>> known = {
      {"", {"device", "servers", "tls", "sap", "settings", "entitlements", "log", "service"}},
      {"device", {"internal_build", "device_class"}},
      {"servers", {"prod", "it", "ut", "maint"}},
      {"servers.prod", {"static_content", "api"}},
      {"servers.it", {"static_content", "api"}},
      {"servers.ut", {"static_content", "api"}},
      {"servers.maint", {"static_content", "api"}},
      {"tls", {"ca_file"}},
      {"sap", {"trust_anchor"}},
      {"settings", {"suite_dir"}},
      {"entitlements", {"dir"}},
      {"service", {"max_workers"}},
      {"log", {"level", "private_data"}},
  };
  auto allowed = known.find(prefix);
  for (const auto& [k, v] : table) {
    std::string key(k.str());
    std::string full = prefix.empty() ? key : prefix + "." + key;
    bool ok = allowed != known.end() &&
              std::find(allowed->second.begin(), allowed->second.end(), key) != allowed->second.end();
    if (!ok) {
      unknown.push_back(full);
      continue;
    }
    if (const toml::table* sub = v.as_table()) collectUnknownKeys(*sub, full, unknown);
  }
}

// toml++ reports a syntax error by throwing: it becomes the file, line and description.
Result<toml::table> parseTOML(const std::filesystem::path& path) {
  try {
    return toml::parse_file(path.string());
  } catch (const toml::parse_error& e) {
    return Failure{path.string() + ":" + std::to_string(e.source().begin.line) + ": " + std::string(e.description())};
  }
}

bool readDevice(Reader& r, Configuration& c) {
  std::string deviceClass;
  bool ok = r.boolean("device.internal_build", c.device.internalBuild, true) &&
            r.string("device.device_class", deviceClass, true);
  c.device.deviceClass = deviceClass;
  return ok;
}

// "prod" is required; the other environments are optional, but complete when given.
bool readServers(Reader& r, Configuration& c) {
  for (const char* env : {"prod", "it", "ut", "maint"}) {
    std::string prefix = std::string("servers.") + env;
    const toml::node* table = r.node(prefix);
    if (!table && std::string_view(env) != "prod") continue;
    if (!table || !table->is_table()) return r.fail(prefix, "missing table (expected static_content and api)");
    ServerEnvironment e;
    bool ok = r.url(prefix + ".static_content", e.staticContent) && r.url(prefix + ".api", e.api);
    c.servers.emplace(env, e);
    if (!ok) return false;
  }
  return true;
}

// The files and directories the daemon reads: the CA bundle, the trust anchor, the settings suite
// and the entitlement manifests.
bool readFiles(Reader& r, Configuration& c) {
  std::string trustAnchor;
  if (!r.string("tls.ca_file", c.caFile, false) || !r.string("sap.trust_anchor", trustAnchor, true)) return false;
  if (trustAnchor.empty()) return r.fail("sap.trust_anchor", "must name a PEM file");
  c.trustAnchor = trustAnchor;
  std::string settingsDir = c.settingsDirectory.string();
  std::string entitlementsDir = c.entitlementsDirectory.string();
  if (!r.string("settings.suite_dir", settingsDir, false) || !r.string("entitlements.dir", entitlementsDir, false))
    return false;
  if (settingsDir.empty()) return r.fail("settings.suite_dir", "must not be empty");
  if (entitlementsDir.empty()) return r.fail("entitlements.dir", "must not be empty");
  c.settingsDirectory = settingsDir;
  c.entitlementsDirectory = entitlementsDir;
  return true;
}

bool readLog(Reader& r, Configuration& c) {
  std::string level(logLevelName(c.logLevel));
  if (!r.string("log.level", level, false) || !r.boolean("log.private_data", c.privateData, false)) return false;
  std::optional<LogLevel> parsed = logLevelFromName(level);
  if (!parsed) return r.fail("log.level", "'" + level + "' is not one of debug, info, default, error, fault");
  c.logLevel = *parsed;
  return true;
}

std::mutex gCurrentMutex;
std::shared_ptr<const Configuration> gCurrent;

}  // namespace

std::optional<std::string> normalizedBaseURL(const std::string& url) {
  std::unique_ptr<CURLU, CurlURLFree> u(curl_url());
  if (!u || curl_url_set(u.get(), CURLUPART_URL, url.c_str(), 0) != CURLUE_OK) return std::nullopt;
  if (part(u.get(), CURLUPART_SCHEME) != "https" || part(u.get(), CURLUPART_HOST).empty()) return std::nullopt;
  std::string path = part(u.get(), CURLUPART_PATH);
  if (!(path.empty() || path == "/") || !part(u.get(), CURLUPART_QUERY).empty() ||
      !part(u.get(), CURLUPART_FRAGMENT).empty() || !part(u.get(), CURLUPART_USER).empty())
    return std::nullopt;
  std::string out = url;
  while (!out.empty() && out.back() == '/') out.pop_back();
  return out;
}

Result<Configuration> loadConfiguration(const std::filesystem::path& path) {
  if (std::optional<std::string> why = unreadableFileReason(path))
    return Failure{path.string() + ": cannot read the configuration file: " + *why};
  Result<toml::table> root = parseTOML(path);
  if (!root) return Failure{root.error()};

  Configuration c;
  c.path = path;
  Reader r(*root, path.string());
  // Each section stops at its first problem, and the reader keeps only the first one.
  bool ok = readDevice(r, c) && readServers(r, c) && readFiles(r, c) && readLog(r, c) &&
            // Each connection worker costs a thread; past a few thousand the bound no longer protects anything.
            r.count("service.max_workers", c.maxWorkers, 2, 4096);
  if (!ok) return Failure{r.error()};

  std::vector<std::string> unknown;
  collectUnknownKeys(*root, "", unknown);
  for (const auto& key : unknown) c.warnings.push_back(path.string() + ": unknown key '" + key + "' ignored");
  return c;
}

void setCurrentConfiguration(Configuration configuration) {
  std::lock_guard lock(gCurrentMutex);
  gCurrent = std::make_shared<const Configuration>(std::move(configuration));
}

std::shared_ptr<const Configuration> currentConfiguration() {
  std::lock_guard lock(gCurrentMutex);
  if (!gCurrent) gCurrent = std::make_shared<const Configuration>();
  return gCurrent;
}

}  // namespace platform
