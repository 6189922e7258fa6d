// Fixtures of the secure-association tests: a test PKI, a device context that tears itself down
// and owns the buffers the primitives return, and a full handshake against a TarvexSAPServer.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace tsaptest {

using Bytes = std::vector<uint8_t>;

inline Bytes bytesOf(std::string_view text) { return Bytes(text.begin(), text.end()); }
inline Bytes operator+(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}
inline Bytes fromHex(std::string_view hex) {
  Bytes out;
  for (std::size_t i = 0; i + 1 < hex.size(); i += 2) {
    out.push_back(static_cast<uint8_t>(std::stoi(std::string(hex.substr(i, 2)), nullptr, 16)));
  }
  return out;
}

// A root with one Ed25519 setup certificate under it.
struct TestPKI {
  explicit TestPKI(const std::string& name)
      : root(*TarvexSAPMakeRoot(name + " SAP Root")),
        setup(*TarvexSAPIssueSetupCertificate(root, name + " Setup")),
        rootPEM(*TarvexSAPCertToPEM(root.certificate.get())),
        setupDER(*TarvexSAPCertToDER(setup.certificate.get())) {}
  // Makes this root the device's only trust anchor.
  void trust(const char* machineIDPath = nullptr) const {
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(rootPEM.data()), rootPEM.size(), machineIDPath};
    ASSERT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
  }

  TarvexSAPCredential root, setup;
  std::string rootPEM;
  Bytes setupDER;
};

struct Exchanged {
  int32_t status;
  uint8_t returnCode = 255;  // as it was when the call did not write it
  Bytes out;
  bool outReturned = false;
};

// A device context torn down at the end of its scope.
struct Device {
  explicit Device(const TarvexHWInfo_& hwInfo = {}) : hw(hwInfo), initStatus(TarvexSAPInit(&handle, &hw)) {}
  ~Device() {
    if (initStatus == kTarvexSAPOK) TarvexSAPTeardown(handle);
  }
  Device(const Device&) = delete;

  Exchanged exchange(const Bytes& in, int32_t selector = 200) {
    Exchanged r;
    uint8_t* out = nullptr;
    uint32_t outLen = 0;
    r.status = TarvexSAPExchange(selector, &hw, handle, in.data(), in.size(), &out, &outLen, &r.returnCode);
    r.outReturned = out != nullptr;
    if (out != nullptr) r.out.assign(out, out + outLen);
    std::free(out);
    return r;
  }
  int32_t sign(const Bytes& data, Bytes* signature = nullptr) {
    uint8_t* sig = nullptr;
    uint32_t sigLen = 0;
    const int32_t status = TarvexSAPSign(handle, data.data(), data.size(), &sig, &sigLen);
    EXPECT_EQ(sig != nullptr, status == kTarvexSAPOK) << "a signature buffer only on success";
    if (signature != nullptr && sig != nullptr) signature->assign(sig, sig + sigLen);
    std::free(sig);
    return status;
  }
  int32_t verify(const Bytes& signature, Bytes data) {
    return TarvexSAPVerify(handle, signature.data(), signature.size(), data.data(), data.size());
  }

  TarvexHWInfo_ hw;
  QVSAPContextOpaque_* handle = nullptr;
  int32_t initStatus;
};

// Certificate exchange, server handshake and session-info exchange; false (and a test failure)
// when any step does not succeed.
inline bool associate(Device& device, TarvexSAPServer& server, const std::string& sessionId, const Bytes& certificate) {
  const Exchanged request = device.exchange(certificate);
  const auto answer = server.handshake(sessionId, request.out, std::chrono::hours(1));
  const int32_t done = device.exchange(Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end())).status;
  const bool ok = request.status == kTarvexSAPOK && answer.status == TarvexSAPServerStatus::ok && done == kTarvexSAPOK;
  EXPECT_TRUE(ok) << "request " << request.status << ", server " << TarvexSAPServerStatusName(answer.status)
                  << ", session info " << done;
  return ok;
}

// Each test: the device trusting `pki_`, and a server holding its setup key on a clock the test
// moves by hand.
class TsapTest : public ::testing::Test {
 protected:
  void SetUp() override { pki_.trust(); }
  std::shared_ptr<std::chrono::steady_clock::time_point> now_ =
      std::make_shared<std::chrono::steady_clock::time_point>();
  TestPKI pki_{"Test"};
  std::unique_ptr<TarvexSAPServer> server_ =
      *TarvexSAPServer::create(pki_.setupDER, pki_.setup.key.get(), [now = now_] { return *now; });
};

}  // namespace tsaptest
