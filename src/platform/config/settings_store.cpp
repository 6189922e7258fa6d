#include "platform/config/settings_store.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <sstream>

#include "platform/config/atomic_file.h"
#include "platform/config/configuration.h"
#include "platform/log/log.h"
#include "platform/values/json.h"
#include "platform/values/unique_fd.h"

namespace platform {

SettingsStore::SettingsStore(std::string suiteName, std::filesystem::path directory)
    : suite_(std::move(suiteName)), path_(directory / (suite_ + ".json")) {}

std::shared_ptr<SettingsStore> SettingsStore::openSuite(std::string suiteName) {
  return std::make_shared<SettingsStore>(std::move(suiteName), currentConfiguration()->settingsDirectory);
}

Dictionary SettingsStore::load() {
  std::lock_guard lock(mutex_);
  struct stat st {};
  if (::stat(path_.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
    stamp_.reset();
    cached_.clear();
    return cached_;
  }
  Stamp now{st.st_dev, st.st_ino, st.st_size, st.st_mtim};
  if (stamp_ && *stamp_ == now) return cached_;
  stamp_ = now;
  cached_.clear();
  std::ifstream in(path_, std::ios::binary);
  std::stringstream text;
  text << in.rdbuf();
  if (!in) return cached_;
  Result<Value> parsed = json::parse(text.str());
  if (parsed && parsed->dictionary()) {
    cached_ = *parsed->dictionary();
  } else {
    log(LogLevel::Error, "Settings suite %@ is unreadable (%@): %@; using no settings", suite_, path_.string(),
        parsed ? std::string("not a JSON object") : parsed.error());
  }
  return cached_;
}

std::optional<Value> SettingsStore::objectForKey(std::string_view key) {
  Dictionary d = load();
  auto it = d.find(key);
  if (it == d.end()) return std::nullopt;
  return it->second;
}

bool SettingsStore::boolForKey(std::string_view key) {
  std::optional<Value> v = objectForKey(key);
  if (!v) return false;
  if (const std::string* s = v->string()) {
    std::string lower(*s);
    std::transform(lower.begin(), lower.end(), lower.begin(), [](unsigned char c) { return std::tolower(c); });
    return lower == "yes" || lower == "true" || lower == "1";
  }
  return v->isNumber() && v->boolValue();
}

std::optional<std::string> SettingsStore::stringForKey(std::string_view key) {
  std::optional<Value> v = objectForKey(key);
  if (!v || !v->string()) return std::nullopt;
  return *v->string();
}

Dictionary SettingsStore::dictionaryRepresentation() { return load(); }

bool SettingsStore::modify(const std::function<void(Dictionary&)>& change) {
  std::error_code ec;
  std::filesystem::create_directories(path_.parent_path(), ec);
  std::string lockPath = path_.string() + ".lock";
  // Closing the descriptor releases the lock.
  UniqueFd lock(::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644));
  if (!lock || ::flock(lock.get(), LOCK_EX) != 0) return false;
  Dictionary d = load();
  change(d);
  Result<std::string> text = json::serialize(Value(d), true);
  return text && !writeFileAtomically(path_, *text + "\n");
}

bool SettingsStore::setObject(std::string_view key, const Value& value) {
  if (!json::isValidJSONObject(Value(Array{value}))) return false;
  return modify([&](Dictionary& d) { d.insert_or_assign(std::string(key), value); });
}

bool SettingsStore::removeObject(std::string_view key) {
  return modify([&](Dictionary& d) {
    auto it = d.find(key);
    if (it != d.end()) d.erase(it);
  });
}

}  // namespace platform
