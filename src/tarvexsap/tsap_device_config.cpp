#include "tarvexsap/tsap_device_config.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <algorithm>
#include <cctype>
#include <fstream>
#include <limits>
#include <mutex>

#include "tarvexsap/tsap_crypto.h"

namespace tsap {
namespace {

constexpr const char* kDefaultMachineIDPath = "/etc/machine-id";
constexpr std::size_t kMachineIDDigits = 32;

std::mutex configMutex;
std::shared_ptr<const DeviceConfig> config;  // guarded by configMutex

struct BioFree {
  void operator()(BIO* bio) const { BIO_free(bio); }
};

// Loads every certificate of the PEM text; null if there is none or any block is not one.
std::unique_ptr<X509_STORE, X509StoreFree> storeFromPEM(const uint8_t* pem, std::size_t len) {
  if (len == 0 || len > static_cast<std::size_t>(std::numeric_limits<int>::max())) {
    return nullptr;
  }
  std::unique_ptr<BIO, BioFree> bio(BIO_new_mem_buf(pem, static_cast<int>(len)));
  std::unique_ptr<X509_STORE, X509StoreFree> store(X509_STORE_new());
  if (!bio || !store) {
    return nullptr;
  }
  int count = 0;
  for (;;) {
    X509Ptr cert(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
    if (!cert) {
      break;
    }
    // OpenSSL fills a certificate's extension cache on first use; doing it here, before
    // the store is shared, keeps concurrent verifications from racing to fill it.
    X509_get_extension_flags(cert.get());
    if (X509_STORE_add_cert(store.get(), cert.get()) != 1) {
      return nullptr;
    }
    ++count;
  }
  // The loop ends on "no start line" at the end of the text; anything else is a broken block.
  const unsigned long err = ERR_peek_last_error();
  const bool cleanEnd = err == 0 || ERR_GET_REASON(err) == PEM_R_NO_START_LINE;
  ERR_clear_error();
  if (count == 0 || !cleanEnd) {
    return nullptr;
  }
  return store;
}

bool isHexDigit(char c) { return std::isxdigit(static_cast<unsigned char>(c)) != 0; }

}  // namespace

int32_t configureDevice(const TarvexSAPConfig* newConfig) {
  if (newConfig == nullptr) {
    std::lock_guard lock(configMutex);
    config.reset();
    return kTarvexSAPOK;
  }
  if (newConfig->trustAnchorPEM == nullptr || newConfig->trustAnchorPEMLength == 0) {
    return kTarvexSAPErrorBadArgument;
  }
  auto fresh = std::make_shared<DeviceConfig>();
  fresh->trustStore = storeFromPEM(newConfig->trustAnchorPEM, newConfig->trustAnchorPEMLength);
  if (!fresh->trustStore) {
    return kTarvexSAPErrorCertificateRejected;
  }
  fresh->machineIDPath = newConfig->machineIDPath != nullptr ? newConfig->machineIDPath : kDefaultMachineIDPath;
  std::lock_guard lock(configMutex);
  config = std::move(fresh);
  return kTarvexSAPOK;
}

std::shared_ptr<const DeviceConfig> currentDeviceConfig() {
  std::lock_guard lock(configMutex);
  return config;
}

bool hardwareIDFromMachineID(const std::string& path, std::array<uint8_t, kHardwareIDMax>& id) {
  // One byte more than the longest valid content shows an over-long file.
  std::string text(kMachineIDDigits + 2, '\0');
  std::ifstream file(path, std::ios::binary);
  std::size_t got = 0;
  if (file) {
    file.read(text.data(), static_cast<std::streamsize>(text.size()));
    got = static_cast<std::size_t>(file.gcount());
  }
  text.resize(got);
  if (text.size() == kMachineIDDigits + 1 && text.back() == '\n') {
    text.pop_back();
  }
  if (text.size() != kMachineIDDigits || !std::all_of(text.begin(), text.end(), isHexDigit)) {
    return randomBytes(id);
  }
  Digest digest{};
  if (!sha256({labelBytes(kLabelHardwareID), labelBytes(text)}, digest)) {
    return false;
  }
  std::copy_n(digest.begin(), id.size(), id.begin());
  return true;
}

}  // namespace tsap
