#include "session_server_delegate.h"

#include <gtest/gtest.h>

namespace saptest {

TestPKI TestPKI::make(const std::string& name) {
  TestPKI pki;
  pki.root = TarvexSAPMakeRoot(name + " SAP Root");
  pki.setup = TarvexSAPIssueSetupCertificate(pki.root, name + " Setup");
  pki.rootPEM = TarvexSAPCertToPEM(pki.root.certificate.get());
  pki.setupDER = TarvexSAPCertToDER(pki.setup.certificate.get());
  return pki;
}

void TestPKI::trust() const {
  const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(rootPEM.data()), rootPEM.size(), nullptr};
  ASSERT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
}

std::unique_ptr<TarvexSAPServer> TestPKI::server() const {
  return std::make_unique<TarvexSAPServer>(setupDER, setup.key.get());
}

TarvexSAPPrimitives libraryPrimitives(std::shared_ptr<void> lifetimeToken) {
  TarvexSAPPrimitives p = TarvexSAPPrimitives::library();
  p.teardown = [lifetimeToken, teardown = p.teardown](QVSAPContextOpaque_* context) { return teardown(context); };
  return p;
}

ServerDelegate::ServerDelegate(TarvexSAPServer& server, Bytes certificate, std::chrono::seconds ttl)
    : server_(&server), certificate_(std::move(certificate)), ttl_(ttl) {}

void ServerDelegate::setCertificate(Bytes certificate) {
  std::lock_guard lock(mutex_);
  certificate_ = std::move(certificate);
}

void ServerDelegate::setServer(TarvexSAPServer& server) {
  std::lock_guard lock(mutex_);
  server_ = &server;
}

void ServerDelegate::corruptSessionInfo(bool corrupt) {
  std::lock_guard lock(mutex_);
  corrupt_ = corrupt;
}

std::vector<Bytes> ServerDelegate::requests() const {
  std::lock_guard lock(mutex_);
  return requests_;
}

void ServerDelegate::sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&, TarvexSAPDataCompletion completion) {
  Bytes certificate;
  {
    std::lock_guard lock(mutex_);
    certificate = certificate_;
  }
  completion(Data(std::move(certificate)), std::nullopt);
}

void ServerDelegate::sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                                        const std::optional<Data>& handshakeData,
                                                                        TarvexSAPDataCompletion completion) {
  TarvexSAPServer* server;
  bool corrupt;
  {
    std::lock_guard lock(mutex_);
    requests_.push_back(handshakeData ? handshakeData->toVector() : Bytes());
    server = server_;
    corrupt = corrupt_;
  }
  if (!handshakeData) {
    completion(std::nullopt, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter, std::nullopt));
    return;
  }
  auto answer = server->handshake(session.UUID().UUIDString(), handshakeData->span(), ttl_);
  if (answer.status != TarvexSAPServerStatus::ok) {
    completion(std::nullopt, QVSAPS_errorWithCode(TarvexSAPSessionErrorBadResponse, std::nullopt));
    return;
  }
  if (corrupt) answer.sessionInfo[100] ^= 0x01;
  session.setTTL(static_cast<double>(ttl_.count()));
  completion(Data(answer.sessionInfo.data(), answer.sessionInfo.size()), std::nullopt);
}

}  // namespace saptest
