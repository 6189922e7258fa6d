// Request verification by the server on an established association.
// Even first byte: second byte % 64 is the signature length, then the signature, then the body;
// never signed by the device, so never accepted. Bit 1 of the first byte picks an unknown
// session instead. Odd first byte: the device signs the body, the request is altered as the
// second byte says (0: untouched); the server must accept exactly the untouched ones, once.
#include <algorithm>
#include <cstdlib>

#include "fuzz_tsap_fixture.h"

namespace {

constexpr const char* kSession = "FUZZ-REQUEST";

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
  TarvexSAPServer& server = *tsapfuzz::fixture().server;
  if ((data[0] & 1) == 0) {
    const size_t sigLen = std::min<size_t>(data[1] % 64, size - 2);
    const char* session = (data[0] & 2) != 0 ? "FUZZ-UNKNOWN" : kSession;
    const auto r = server.verifyRequest(session, std::span<const uint8_t>(data + 2, sigLen),
                                        std::span<const uint8_t>(data + 2 + sigLen, size - 2 - sigLen));
    if (r.status == TarvexSAPServerStatus::ok) {
      tsapfuzz::violated("forged request accepted");
    }
    return 0;
  }
  std::vector<uint8_t> body(data + 2, data + size);
  uint8_t* raw = nullptr;
  uint32_t rawLen = 0;
  if (TarvexSAPSign(handle, body.data(), body.size(), &raw, &rawLen) != kTarvexSAPOK || rawLen != 40) {
    tsapfuzz::violated("sign");
  }
  std::vector<uint8_t> sig(raw, raw + rawLen);
  std::free(raw);
  const uint8_t change = data[1];
  if (change != 0) {
    if ((change & 1) != 0 && !body.empty()) {
      body[(change >> 1) % body.size()] ^= 0x01;
    } else {
      sig[(change >> 1) % sig.size()] ^= 0x80;
    }
  }
  const auto first = server.verifyRequest(kSession, sig, body);
  if ((first.status == TarvexSAPServerStatus::ok) != (change == 0)) {
    tsapfuzz::violated(change == 0 ? "genuine request refused" : "altered request accepted");
  }
  if (server.verifyRequest(kSession, sig, body).status == TarvexSAPServerStatus::ok) {
    tsapfuzz::violated("request accepted twice");
  }
  return 0;
}
