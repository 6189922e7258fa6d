// Throughput of the secure-association primitives, device and server in one process:
// a signed round trip (device sign, server verify, server sign, device verify) for a typical
// ~300-byte body, and complete handshakes (init, certificate, server handshake, session info,
// teardown).
#include <benchmark/benchmark.h>

#include <cstdlib>
#include <memory>
#include <stdexcept>
#include <string>

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace {

struct Setup {
  TarvexSAPCredential root = *TarvexSAPMakeRoot("Bench SAP Root");
  TarvexSAPCredential setup = *TarvexSAPIssueSetupCertificate(root, "Bench Setup");
  std::vector<uint8_t> setupDER = *TarvexSAPCertToDER(setup.certificate.get());
  std::unique_ptr<TarvexSAPServer> server = *TarvexSAPServer::create(setupDER, setup.key.get());

  Setup() {
    const std::string pem = *TarvexSAPCertToPEM(root.certificate.get());
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(pem.data()), pem.size(), nullptr};
    if (TarvexSAPConfigure(&config) != kTarvexSAPOK) {
      throw std::runtime_error("configure");
    }
  }
};

Setup& setup() {
  static Setup s;
  return s;
}

// One full handshake; returns the associated handle, or null.
QVSAPContextOpaque_* handshake(Setup& s, const char* sessionId) {
  QVSAPContextOpaque_* handle = nullptr;
  TarvexHWInfo_ hw{};
  hw.IDLength = 8;
  if (TarvexSAPInit(&handle, &hw) != kTarvexSAPOK) {
    return nullptr;
  }
  uint8_t* out = nullptr;
  uint32_t outLen = 0;
  uint8_t code = 255;
  if (TarvexSAPExchange(200, &hw, handle, s.setupDER.data(), s.setupDER.size(), &out, &outLen, &code) != kTarvexSAPOK) {
    TarvexSAPTeardown(handle);
    return nullptr;
  }
  const auto answer = s.server->handshake(sessionId, std::span<const uint8_t>(out, outLen), std::chrono::hours(1));
  std::free(out);
  out = nullptr;
  if (answer.status != TarvexSAPServerStatus::ok ||
      TarvexSAPExchange(200, &hw, handle, answer.sessionInfo.data(), answer.sessionInfo.size(), &out, &outLen, &code) !=
          kTarvexSAPOK) {
    TarvexSAPTeardown(handle);
    return nullptr;
  }
  return handle;
}

void BM_SignedRoundTrip(benchmark::State& state) {
  Setup& s = setup();
  QVSAPContextOpaque_* handle = handshake(s, "BENCH-ROUNDTRIP");
  if (handle == nullptr) {
    state.SkipWithError("handshake failed");
    return;
  }
  std::vector<uint8_t> request(static_cast<std::size_t>(state.range(0)), 'r');
  std::vector<uint8_t> response(static_cast<std::size_t>(state.range(0)), 'a');
  for (auto _ : state) {
    uint8_t* sig = nullptr;
    uint32_t sigLen = 0;
    if (TarvexSAPSign(handle, request.data(), request.size(), &sig, &sigLen) != kTarvexSAPOK) {
      state.SkipWithError("sign");
      break;
    }
    const auto accepted = s.server->verifyRequest("BENCH-ROUNDTRIP", std::span<const uint8_t>(sig, sigLen), request);
    std::free(sig);
    const auto answer = s.server->signResponse("BENCH-ROUNDTRIP", accepted.seq, response);
    if (accepted.status != TarvexSAPServerStatus::ok ||
        TarvexSAPVerify(handle, answer.signature.data(), answer.signature.size(), response.data(), response.size()) !=
            kTarvexSAPOK) {
      state.SkipWithError("verify");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations());
  state.SetBytesProcessed(state.iterations() * 2 * state.range(0));
  TarvexSAPTeardown(handle);
}
BENCHMARK(BM_SignedRoundTrip)->Arg(300)->Arg(4096);

void BM_Handshake(benchmark::State& state) {
  Setup& s = setup();
  for (auto _ : state) {
    QVSAPContextOpaque_* handle = handshake(s, "BENCH-HANDSHAKE");
    if (handle == nullptr) {
      state.SkipWithError("handshake failed");
      break;
    }
    TarvexSAPTeardown(handle);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Handshake);

}  // namespace

BENCHMARK_MAIN();
