// Acceptance of the server's setup certificate on the device: DER (or PEM when the bytes start
// with "-----BEGIN"), chained to the trust anchor under strict X.509 checks with validity dates,
// Ed25519 subject key, not a CA, keyUsage digitalSignature. Internal to the library.
#pragma once

#include "tarvexsap/tsap_crypto.h"
#include "tarvexsap/tsap_device_config.h"

namespace tsap {

// On success returns kTarvexSAPOK and the certificate's public key.
int32_t acceptSetupCertificate(const DeviceConfig& config, Bytes certificate, PKeyPtr& publicKey);

}  // namespace tsap
