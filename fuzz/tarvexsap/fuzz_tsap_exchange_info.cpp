// A real first exchange with the fixed certificate, then an arbitrary session info.
// Even first byte: the rest is the session info as is; it can never carry a valid signature, so
// it must be refused. Odd first byte: the next 65 bytes (version, server key, nonce) are signed
// with the genuine setup key, reaching the version check and the key agreement with arbitrary
// server keys; success then requires version 1 and a usable association.
#include <openssl/evp.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "fuzz_tsap_fixture.h"

namespace {

std::vector<uint8_t> signedInfo(const std::vector<uint8_t>& request, const uint8_t* fields, size_t size) {
  std::vector<uint8_t> info(65, 0);
  std::copy_n(fields, std::min<size_t>(size, 65), info.begin());
  const char label[] = "TSAP1 transcript";
  std::vector<uint8_t> transcript(label, label + sizeof label - 1);
  transcript.insert(transcript.end(), request.begin(), request.end());
  transcript.insert(transcript.end(), info.begin(), info.end());
  uint8_t t[32];
  unsigned int tLen = 0;
  uint8_t sig[64];
  size_t sigLen = sizeof sig;
  EVP_MD_CTX* ctx = EVP_MD_CTX_new();
  if (EVP_Digest(transcript.data(), transcript.size(), t, &tLen, EVP_sha256(), nullptr) != 1 || ctx == nullptr ||
      EVP_DigestSignInit(ctx, nullptr, nullptr, nullptr, tsapfuzz::fixture().setup.key.get()) != 1 ||
      EVP_DigestSign(ctx, sig, &sigLen, t, sizeof t) != 1) {
    tsapfuzz::violated("harness signature");
  }
  EVP_MD_CTX_free(ctx);
  info.insert(info.end(), sig, sig + sizeof sig);
  return info;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) {
    return 0;
  }
  tsapfuzz::PendingDevice device = tsapfuzz::startDevice();
  const bool sign = (data[0] & 1) != 0;
  const std::vector<uint8_t> info =
      sign ? signedInfo(device.request, data + 1, size - 1) : std::vector<uint8_t>(data + 1, data + size);

  uint8_t* out = nullptr;
  uint32_t outLen = 0;
  uint8_t code = 255;
  const int32_t status =
      TarvexSAPExchange(200, &device.hw, device.handle, info.data(), info.size(), &out, &outLen, &code);
  if (out != nullptr) {
    tsapfuzz::violated("second exchange returned a buffer");
  }
  if (status == kTarvexSAPOK) {
    if (!sign) {
      tsapfuzz::violated("unsigned session info accepted");
    }
    if (code != 0 || info[0] != 1) {
      tsapfuzz::violated("accepted with wrong return code or version");
    }
    uint8_t* sig = nullptr;
    uint32_t sigLen = 0;
    if (TarvexSAPSign(device.handle, data, size, &sig, &sigLen) != kTarvexSAPOK || sigLen != 40) {
      tsapfuzz::violated("association unusable");
    }
    std::free(sig);
  }
  TarvexSAPTeardown(device.handle);
  return 0;
}
