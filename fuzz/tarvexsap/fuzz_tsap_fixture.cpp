#include "fuzz_tsap_fixture.h"

#include <cstdio>
#include <cstdlib>

namespace tsapfuzz {
namespace {

Fixture build() {
  std::array<uint8_t, 32> rootSeed{};
  std::array<uint8_t, 32> setupSeed{};
  rootSeed.fill(0x52);
  setupSeed.fill(0x53);
  const TarvexSAPKey rootKey = *TarvexSAPEd25519KeyFromSeed(rootSeed);
  const TarvexSAPKey setupKey = *TarvexSAPEd25519KeyFromSeed(setupSeed);
  // Long validity so that stored seeds keep verifying.
  const TarvexSAPValidity validity{std::chrono::hours(-24), std::chrono::hours(24 * 365 * 50)};
  Fixture f;
  f.root = *TarvexSAPMakeRoot("Fuzz SAP Root", validity, rootKey.get());
  f.setup = *TarvexSAPIssueSetupCertificate(f.root, "Fuzz Setup", validity, setupKey.get());
  f.setupDER = *TarvexSAPCertToDER(f.setup.certificate.get());
  f.server = *TarvexSAPServer::create(f.setupDER, f.setup.key.get());
  const std::string pem = *TarvexSAPCertToPEM(f.root.certificate.get());
  const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(pem.data()), pem.size(), nullptr};
  if (TarvexSAPConfigure(&config) != kTarvexSAPOK) {
    violated("configure");
  }
  return f;
}

}  // namespace

void violated(const char* what) {
  std::fprintf(stderr, "fuzz_tsap: property violated: %s\n", what);
  std::abort();
}

const Fixture& fixture() {
  static const Fixture f = build();
  return f;
}

PendingDevice startDevice() {
  const Fixture& f = fixture();
  PendingDevice device;
  device.hw.IDLength = 4;
  if (TarvexSAPInit(&device.handle, &device.hw) != kTarvexSAPOK) {
    violated("init");
  }
  uint8_t* out = nullptr;
  uint32_t outLen = 0;
  uint8_t code = 255;
  if (TarvexSAPExchange(200, &device.hw, device.handle, f.setupDER.data(), f.setupDER.size(), &out, &outLen, &code) !=
          kTarvexSAPOK ||
      code != 1 || out == nullptr) {
    violated("certificate exchange");
  }
  device.request.assign(out, out + outLen);
  std::free(out);
  return device;
}

QVSAPContextOpaque_* associatedDevice(const char* sessionId) {
  const Fixture& f = fixture();
  PendingDevice device = startDevice();
  const auto answer = f.server->handshake(sessionId, device.request, std::chrono::hours(24 * 365));
  uint8_t* out = nullptr;
  uint32_t outLen = 0;
  uint8_t code = 255;
  if (answer.status != TarvexSAPServerStatus::ok ||
      TarvexSAPExchange(200, &device.hw, device.handle, answer.sessionInfo.data(), answer.sessionInfo.size(), &out,
                        &outLen, &code) != kTarvexSAPOK ||
      code != 0) {
    violated("association");
  }
  std::free(out);
  return device.handle;
}

}  // namespace tsapfuzz
