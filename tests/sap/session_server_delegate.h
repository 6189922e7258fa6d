// A session delegate that answers from an in-process TarvexSAPServer, the way the transport
// answers from the real one: the certificate as served, and the handshake with the session's TTL
// set before the answer. Plus a test PKI and the library's primitive table.
#pragma once

#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "sap/tarvex_sap_session.h"
#include "sap_test_support.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace saptest {

// A root with one setup certificate under it.
struct TestPKI {
  TarvexSAPCredential root;
  TarvexSAPCredential setup;
  std::string rootPEM;
  Bytes setupDER;

  static TestPKI make(const std::string& name);
  // Makes this root the device's only trust anchor.
  void trust() const;
  std::unique_ptr<TarvexSAPServer> server() const;
};

// TarvexSAPPrimitives::library(), whose table also holds `lifetimeToken`.
TarvexSAPPrimitives libraryPrimitives(std::shared_ptr<void> lifetimeToken);

class ServerDelegate : public TarvexSAPSessionDelegate {
 public:
  ServerDelegate(TarvexSAPServer& server, Bytes certificate, std::chrono::seconds ttl = std::chrono::seconds(3600));

  void setCertificate(Bytes certificate);
  void setServer(TarvexSAPServer& server);
  void corruptSessionInfo(bool corrupt);
  // The handshake requests received, in order.
  std::vector<Bytes> requests() const;

  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession& session,
                                                      TarvexSAPDataCompletion completion) override;
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                          const std::optional<Data>& handshakeData,
                                                          TarvexSAPDataCompletion completion) override;

 private:
  mutable std::mutex mutex_;
  TarvexSAPServer* server_;
  Bytes certificate_;
  std::chrono::seconds ttl_;
  bool corrupt_ = false;
  std::vector<Bytes> requests_;
};

}  // namespace saptest
