// Response verification on an established association.
// Even first byte: second byte % 64 is the signature length, then the signature, then the body;
// such a response was never signed by the server, so it must be refused.
// Odd first byte: a genuine round (device signs the body, server verifies and answers) whose
// answer is then altered as the second byte says (0: untouched); the device must accept
// exactly the untouched answers.
#include <algorithm>
#include <cstdlib>

#include "fuzz_tsap_fixture.h"

namespace {

constexpr const char* kSession = "FUZZ-VERIFY";

QVSAPContextOpaque_* device() {
  static QVSAPContextOpaque_* const handle = tsapfuzz::associatedDevice(kSession);
  return handle;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2) {
    return 0;
  }
  QVSAPContextOpaque_* handle = device();
  if ((data[0] & 1) == 0) {
    const size_t sigLen = std::min<size_t>(data[1] % 64, size - 2);
    std::vector<uint8_t> body(data + 2 + sigLen, data + size);
    if (TarvexSAPVerify(handle, data + 2, sigLen, body.data(), body.size()) == kTarvexSAPOK) {
      tsapfuzz::violated("forged response accepted");
    }
    return 0;
  }
  std::vector<uint8_t> body(data + 2, data + size);
  uint8_t* sig = nullptr;
  uint32_t sigLen = 0;
  if (TarvexSAPSign(handle, body.data(), body.size(), &sig, &sigLen) != kTarvexSAPOK) {
    tsapfuzz::violated("sign");
  }
  TarvexSAPServer& server = *tsapfuzz::fixture().server;
  const auto accepted = server.verifyRequest(kSession, std::span<const uint8_t>(sig, sigLen), body);
  std::free(sig);
  if (accepted.status != TarvexSAPServerStatus::ok) {
    tsapfuzz::violated("server refused a genuine request");
  }
  auto answer = server.signResponse(kSession, accepted.seq, body);
  const uint8_t change = data[1];
  if (change != 0) {
    // Low bit: alter the body if there is one, otherwise the signature.
    if ((change & 1) != 0 && !body.empty()) {
      body[(change >> 1) % body.size()] ^= 0x01;
    } else {
      answer.signature[(change >> 1) % answer.signature.size()] ^= 0x80;
    }
  }
  const int32_t status =
      TarvexSAPVerify(handle, answer.signature.data(), answer.signature.size(), body.data(), body.size());
  if ((status == kTarvexSAPOK) != (change == 0)) {
    tsapfuzz::violated(change == 0 ? "genuine response refused" : "altered response accepted");
  }
  return 0;
}
