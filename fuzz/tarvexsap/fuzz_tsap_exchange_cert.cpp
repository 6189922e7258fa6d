// Arbitrary bytes as the setup certificate of a first exchange. Whatever is accepted must be a
// parsable, non-CA certificate, and must produce exactly one 90-byte handshake request.
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <cstdlib>
#include <cstring>

#include "fuzz_tsap_fixture.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tsapfuzz::fixture();
  QVSAPContextOpaque_* handle = nullptr;
  TarvexHWInfo_ hw{};
  hw.IDLength = 3;
  if (TarvexSAPInit(&handle, &hw) != kTarvexSAPOK) {
    tsapfuzz::violated("init");
  }
  uint8_t* out = nullptr;
  uint32_t outLen = 0;
  uint8_t code = 255;
  const int32_t status = TarvexSAPExchange(200, &hw, handle, data, size, &out, &outLen, &code);
  if (status == kTarvexSAPOK) {
    if (code != 1 || out == nullptr || outLen != 90 || std::memcmp(out, "TSAP\x01\x03", 6) != 0) {
      tsapfuzz::violated("accepted certificate without a proper request");
    }
    const unsigned char* p = data;
    X509* cert = d2i_X509(nullptr, &p, static_cast<long>(size));
    if (cert == nullptr) {
      BIO* bio = BIO_new_mem_buf(data, static_cast<int>(size));
      cert = PEM_read_bio_X509(bio, nullptr, nullptr, nullptr);
      BIO_free(bio);
    }
    if (cert == nullptr || X509_check_ca(cert) != 0) {
      tsapfuzz::violated("accepted something that is not a setup certificate");
    }
    X509_free(cert);
    ERR_clear_error();
  } else if (out != nullptr || outLen != 0 || code != 255) {
    tsapfuzz::violated("outputs written on failure");
  }
  std::free(out);
  if (TarvexSAPTeardown(handle) != kTarvexSAPOK || TarvexSAPTeardown(handle) != kTarvexSAPErrorUnknownHandle) {
    tsapfuzz::violated("teardown");
  }
  return 0;
}
