#include "network/zlka_network.h"

#include <atomic>

#include "network/zlka_network_exported.h"
#include "platform/config/configuration.h"
#include "platform/log/log.h"
#include "platform/values/exception.h"
#include "support/system_info.h"

using platform::LogLevel;

namespace {
constexpr char kClassName[] = "ZLKANetwork";
std::atomic<bool> gMade{false};
}  // namespace

ZLKANetwork::ZLKANetwork(Private) {}

std::shared_ptr<ZLKANetwork> ZLKANetwork::sharedInstance() {
  static std::once_flag once;
  static std::shared_ptr<ZLKANetwork> instance;
  std::call_once(once, [] {
    auto made = std::make_shared<ZLKANetwork>(Private{});
    made->_init();
    instance = std::move(made);
    gMade.store(true);
  });
  return instance;
}

std::shared_ptr<ZLKANetwork> ZLKANetwork::existingInstance() { return gMade.load() ? sharedInstance() : nullptr; }

std::shared_ptr<ZLKANetwork> ZLKANetwork::init() {
  throw platform::InternalInconsistencyException(std::string("Use +[") + kClassName + " sharedInstance] instead of +[" +
                                                 kClassName + " init].");
}

void ZLKANetwork::_init() {
  platform::log(LogLevel::Debug, "[#TokenAuth] Initializing %@...", kClassName);
  exportedObject_ = std::make_shared<ZLKANetworkExported>();
  isInternalBuild_ = systemInfo_isInternalBuild();
  userDefaults_ = platform::SettingsStore::openSuite(ZLKAUserDefaultsDomain);
  urlSession_ = platform::HTTPSession::sessionWithConfiguration(
      platform::HTTPSessionConfiguration::ephemeralSessionConfiguration());
  tarvexSAPSession_ = TarvexSAPSession::sessionWithDelegate(weak_from_this());
  platform::log(LogLevel::Debug, "[#TokenAuth] Initialized Tarvex SAP Session: %@", tarvexSAPSession_->description());
}

ZLKANetwork::~ZLKANetwork() {
  platform::log(LogLevel::Info, "[#TokenAuth] Invalidating HTTPSession...");
  if (urlSession_) urlSession_->invalidateAndCancel();
}

// The switches read the suite at every call (a production device never does); the stored fields
// are deliberately ignored.
bool ZLKANetwork::forceNetworkFailure() {
  return isInternalBuild() && userDefaults()->boolForKey(ZLKAUserDefaultsKey_ForceNetworkFailure);
}
bool ZLKANetwork::forceTokenActivationFailure() {
  return isInternalBuild() && userDefaults()->boolForKey(ZLKAUserDefaultsKey_ForceTokenActivationFailure);
}
bool ZLKANetwork::forceTokenConfirmationFailure() {
  return isInternalBuild() && userDefaults()->boolForKey(ZLKAUserDefaultsKey_ForceTokenConfirmationFailure);
}
bool ZLKANetwork::forceTarvexSAPFailure() {
  return isInternalBuild() && userDefaults()->boolForKey(ZLKAUserDefaultsKey_ForceTarvexSAPFailure);
}

void ZLKANetwork::setForceNetworkFailure(bool value) {
  std::lock_guard lock(mutex_);
  forceNetworkFailure_ = value;
}
void ZLKANetwork::setForceTokenActivationFailure(bool value) {
  std::lock_guard lock(mutex_);
  forceTokenActivationFailure_ = value;
}
void ZLKANetwork::setForceTokenConfirmationFailure(bool value) {
  std::lock_guard lock(mutex_);
  forceTokenConfirmationFailure_ = value;
}
void ZLKANetwork::setForceTarvexSAPFailure(bool value) {
  std::lock_guard lock(mutex_);
  forceTarvexSAPFailure_ = value;
}

std::string ZLKANetwork::selectServer(const char* key, bool offerCustom,
                                      std::string (*pick)(const platform::ServerEnvironment&)) {
  auto configuration = platform::currentConfiguration();
  auto prod = configuration->servers.find("prod");
  std::string production = prod != configuration->servers.end() ? pick(prod->second) : std::string();
  // A production device never consults the suite.
  if (!systemInfo_isInternalBuild()) return production;
  std::shared_ptr<platform::SettingsStore> defaults = userDefaults();
  std::optional<std::string> name = defaults->stringForKey(key);
  if (!name) return production;
  if (offerCustom && *name == "custom") return defaults->stringForKey(ZLKAUserDefaultsKey_CustomServer).value_or("");
  auto it = configuration->servers.find(*name);
  if (it != configuration->servers.end()) return pick(it->second);
  platform::log(LogLevel::Error, "[#TokenAuth] Unknown server selected: '%@'. Falling back to production server...",
                *name);
  return production;
}

std::string ZLKANetwork::_selectedStaticContentServer() {
  return selectServer(ZLKAUserDefaultsKey_StaticContentServer, false,
                      [](const platform::ServerEnvironment& e) { return e.staticContent; });
}

std::string ZLKANetwork::_selectedTarvexSAPServer() {
  return selectServer(ZLKAUserDefaultsKey_TarvexSAPServer, false,
                      [](const platform::ServerEnvironment& e) { return e.api; });
}

std::string ZLKANetwork::_selectedAPIServer() {
  return selectServer(ZLKAUserDefaultsKey_Server, true, [](const platform::ServerEnvironment& e) { return e.api; });
}

std::shared_ptr<ZLKANetworkProtocol> ZLKANetwork::exportedObject() const {
  std::lock_guard lock(mutex_);
  return exportedObject_;
}
bool ZLKANetwork::isInternalBuild() const {
  std::lock_guard lock(mutex_);
  return isInternalBuild_;
}
void ZLKANetwork::setIsInternalBuild(bool value) {
  std::lock_guard lock(mutex_);
  isInternalBuild_ = value;
}
std::shared_ptr<platform::SettingsStore> ZLKANetwork::userDefaults() const {
  std::lock_guard lock(mutex_);
  return userDefaults_;
}
void ZLKANetwork::setUserDefaults(std::shared_ptr<platform::SettingsStore> value) {
  std::lock_guard lock(mutex_);
  userDefaults_ = std::move(value);
}
std::shared_ptr<platform::HTTPSession> ZLKANetwork::urlSession() const {
  std::lock_guard lock(mutex_);
  return urlSession_;
}
void ZLKANetwork::setUrlSession(std::shared_ptr<platform::HTTPSession> value) {
  std::lock_guard lock(mutex_);
  urlSession_ = std::move(value);
}
std::shared_ptr<TarvexSAPSession> ZLKANetwork::tarvexSAPSession() const {
  std::lock_guard lock(mutex_);
  return tarvexSAPSession_;
}
void ZLKANetwork::setTarvexSAPSession(std::shared_ptr<TarvexSAPSession> value) {
  std::lock_guard lock(mutex_);
  tarvexSAPSession_ = std::move(value);
}
