// Process-wide device configuration: the trust store built from the anchor PEM and the
// machine-id path. Replaced atomically; contexts keep the configuration they started with.
// Internal to the library.
#pragma once

#include <openssl/x509_vfy.h>

#include <array>
#include <memory>
#include <string>

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tsap_wire.h"

namespace tsap {

struct X509StoreFree {
  // Frees the store and the certificates it holds (X509_STORE_free).
  void operator()(X509_STORE* store) const { X509_STORE_free(store); }
};

struct DeviceConfig {
  std::unique_ptr<X509_STORE, X509StoreFree> trustStore;
  std::string machineIDPath;
};

// configureDevice is TarvexSAPConfigure.
int32_t configureDevice(const TarvexSAPConfig* config);
// currentDeviceConfig is the configuration in force, shared, or null when none is.
std::shared_ptr<const DeviceConfig> currentDeviceConfig();

// First 20 bytes of SHA-256("TSAP1 hwid" || the 32 hex digits of the machine-id file); random
// bytes when the file is missing or not exactly 32 hex digits and an optional newline.
bool hardwareIDFromMachineID(const std::string& path, std::array<uint8_t, kHardwareIDMax>& id);

}  // namespace tsap
