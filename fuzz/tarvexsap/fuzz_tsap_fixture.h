// Deterministic set-up shared by the secure-association fuzz targets, built once per process:
// a root and setup certificate from fixed seeds (so seed corpora stay valid across runs), the
// device configured to trust that root, a server holding the setup key, and helpers to open an
// association between the two.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace tsapfuzz {

struct Fixture {
  TarvexSAPCredential root;
  TarvexSAPCredential setup;
  std::vector<uint8_t> setupDER;
  std::unique_ptr<TarvexSAPServer> server;
};

const Fixture& fixture();

// A device context that has sent its handshake request; null handle on failure.
struct PendingDevice {
  QVSAPContextOpaque_* handle = nullptr;
  TarvexHWInfo_ hw{};
  std::vector<uint8_t> request;
};
PendingDevice startDevice();

// A device context associated with the fixture's server under `sessionId`. Aborts on failure:
// the set-up must never fail.
QVSAPContextOpaque_* associatedDevice(const char* sessionId);

// Aborts the run: a property that must hold did not.
[[noreturn]] void violated(const char* what);

}  // namespace tsapfuzz
