// ZLKANetwork: the one object that does the service's work. It runs the three token operations,
// signs and verifies through its secure-association session, and serves that session as its
// delegate for the certificate download and the handshake.
//
// sharedInstance() makes it on first use (once per process): the exported object, the
// internal-build flag, the settings suite, an ephemeral HTTP session and the session. On an
// internal build the settings suite selects the servers and injects faults, read afresh at every
// use; on a production device it is never consulted. The switch setters store a value that the
// getters never read: the suite is the only control.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "network/zlka_network_constants.h"
#include "network/zlka_network_protocol.h"
#include "platform/config/configuration.h"
#include "platform/config/settings_store.h"
#include "platform/http/http_session.h"
#include "sap/tarvex_sap_session.h"

class ZLKANetwork final : public ZLKANetworkProtocol,
                          public TarvexSAPSessionDelegate,
                          public std::enable_shared_from_this<ZLKANetwork> {
 public:
  // sharedInstance is the process's one instance, made on the first call (on any thread, once) and
  // never destroyed.
  static std::shared_ptr<ZLKANetwork> sharedInstance();
  // existingInstance is the shared instance once something has made it, else null (it never makes
  // one: monitoring must not start the session's machinery).
  static std::shared_ptr<ZLKANetwork> existingInstance();
  // Forbidden: the instance comes from sharedInstance(). Throws InternalInconsistencyException.
  [[noreturn]] static std::shared_ptr<ZLKANetwork> init();
  ~ZLKANetwork() override;

  // The token operations.
  void requestMetadataForToken(const std::optional<platform::Data>& token, const std::optional<std::string>& uuid,
                               const std::optional<platform::Locale>& requestedLocale,
                               const std::optional<platform::Dictionary>& requestInfo,
                               ZLKAMetadataReply reply) override;
  void requestActivationForToken(const std::optional<platform::Data>& token, const std::optional<std::string>& uuid,
                                 ZLKAActivationReply reply) override;
  void confirmActivationForToken(const std::optional<platform::Data>& token, const std::optional<std::string>& uuid,
                                 ZLKAConfirmationReply reply) override;

  // The session's certificate and handshake transport.
  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession& session,
                                                      TarvexSAPDataCompletion completion) override;
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                          const std::optional<platform::Data>& handshakeData,
                                                          TarvexSAPDataCompletion completion) override;

  // Fault-injection switches: each is true only on an internal build whose suite holds true for
  // its key (ForceNetworkFailure, ...), read afresh at every call.
  bool forceNetworkFailure();
  bool forceTokenActivationFailure();
  bool forceTokenConfirmationFailure();
  bool forceTarvexSAPFailure();
  // The setters store a value that the switches above never read (see the top of this file).
  void setForceNetworkFailure(bool value);
  void setForceTokenActivationFailure(bool value);
  void setForceTokenConfirmationFailure(bool value);
  void setForceTarvexSAPFailure(bool value);

  // Base URLs to use now (no trailing slash): the prod environment's, or on an internal build the
  // environment its suite names under StaticContentServer, TarvexSAPServer and Server (an unknown
  // name falls back to prod with an error line; Server "custom" answers CustomServer, or "" when it
  // is not set). "" when the configuration has no such server.
  std::string _selectedStaticContentServer();
  std::string _selectedTarvexSAPServer();
  std::string _selectedAPIServer();

  // The parts made by sharedInstance(), shared; the setters replace them (tests) and the next use
  // reads the new one. isInternalBuild is the device fact read at creation.
  std::shared_ptr<ZLKANetworkProtocol> exportedObject() const;
  bool isInternalBuild() const;
  void setIsInternalBuild(bool value);
  std::shared_ptr<platform::SettingsStore> userDefaults() const;
  void setUserDefaults(std::shared_ptr<platform::SettingsStore> value);
  std::shared_ptr<platform::HTTPSession> urlSession() const;
  void setUrlSession(std::shared_ptr<platform::HTTPSession> value);
  std::shared_ptr<TarvexSAPSession> tarvexSAPSession() const;
  void setTarvexSAPSession(std::shared_ptr<TarvexSAPSession> value);

  // The request pipeline shared by the operations. Out-parameters may be null.
  //
  // _openTarvexSAPSession opens the session when it is closed and waits, without a time limit,
  // for the open to end; nullopt when the session is open or being opened, else the open's error.
  std::optional<platform::Error> _openTarvexSAPSession();
  // _tarvexSignatureForDataSync opens the session if needed, then waits up to 10 s for the
  // signature of `data`. nullopt on failure, with *error the open's or signing's error, or
  // *timedOut true when the wait ran out (a late signature is dropped).
  std::optional<platform::Data> _tarvexSignatureForDataSync(const platform::Data& data, bool* timedOut,
                                                            std::optional<platform::Error>* error);
  // _verifyTarvexSignatureSync waits up to 10 s for the session's verdict on `signature` over
  // `data`, without opening it; false on failure, with *error or *timedOut set as above.
  bool _verifyTarvexSignatureSync(const std::optional<platform::Data>& signature, const platform::Data& data,
                                  bool* timedOut, std::optional<platform::Error>* error);
  // _generateTokenAuthURLRequestForEndpoint makes the JSON POST to `endpoint` on the selected API
  // server, 60 s time-out, carrying the session identifier and the base64 signature as headers
  // when given. It cannot fail; an unusable base URL fails the upload instead.
  platform::HTTPRequest _generateTokenAuthURLRequestForEndpoint(const std::string& endpoint,
                                                                const std::optional<std::string>& sessionID,
                                                                const std::optional<platform::Data>& signature);

 private:
  struct Private {};

 public:
  // Only sharedInstance() can call this, through make_shared; the parts are made by _init().
  explicit ZLKANetwork(Private);

 private:
  void _init();
  std::string selectServer(const char* key, bool offerCustom, std::string (*pick)(const platform::ServerEnvironment&));

  mutable std::mutex mutex_;
  bool isInternalBuild_ = false;
  bool forceNetworkFailure_ = false;  // stored, never read back
  bool forceTokenActivationFailure_ = false;
  bool forceTokenConfirmationFailure_ = false;
  bool forceTarvexSAPFailure_ = false;
  std::shared_ptr<ZLKANetworkProtocol> exportedObject_;
  std::shared_ptr<platform::SettingsStore> userDefaults_;
  std::shared_ptr<platform::HTTPSession> urlSession_;
  std::shared_ptr<TarvexSAPSession> tarvexSAPSession_;
};
