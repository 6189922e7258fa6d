// One device-side association: the handshake steps, then request signing and response
// verification. Callers hold `mutex` around every call. Internal to the library.
#pragma once

#include <memory>
#include <mutex>

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tsap_device_config.h"
#include "tarvexsap/tsap_outstanding.h"
#include "tarvexsap/tsap_protocol.h"

namespace tsap {

class DeviceContext {
 public:
  enum class State { awaitingCertificate, awaitingSessionInfo, associated, failed, tornDown };

  // DeviceContext starts awaiting the setup certificate, under `config` (shared) for its whole life.
  explicit DeviceContext(std::shared_ptr<const DeviceConfig> config) : config_(std::move(config)) {}
  ~DeviceContext() { erase(); }
  DeviceContext(const DeviceContext&) = delete;
  DeviceContext& operator=(const DeviceContext&) = delete;

  // First call: certificate in, handshake request out. Second: session info in, nothing out.
  // `returnCode` is written only on success.
  // Statuses as TarvexSAPExchange's.
  int32_t exchange(const TarvexHWInfo_& hwInfo, Bytes in, RequestBytes& request, bool& produced, uint8_t& returnCode);
  // sign writes the signature of `data` under the next sequence number; statuses as TarvexSAPSign's.
  int32_t sign(Bytes data, SignatureBytes& signature);
  // verify checks a response's signature and uses its sequence number up; statuses as
  // TarvexSAPVerify's.
  int32_t verify(Bytes signature, Bytes data);
  // Erases every secret and refuses all later calls.
  void tearDown();

  // state is where the context is in its life.
  State state() const { return state_; }
  std::mutex mutex;

 private:
  int32_t acceptCertificate(const TarvexHWInfo_& hwInfo, Bytes certificate, RequestBytes& request);
  int32_t acceptSessionInfo(Bytes info);
  void erase();

  std::shared_ptr<const DeviceConfig> config_;
  State state_ = State::awaitingCertificate;
  PKeyPtr serverKey_;       // setup certificate key, until the session info is checked
  PKeyPtr ephemeral_;       // X25519 private key; OpenSSL clears it when freed
  RequestBytes request_{};  // first half of the transcript
  std::array<uint8_t, kNonceSize> clientNonce_{};
  SessionKeys keys_;
  uint64_t lastSeq_ = 0;
  OutstandingSeqs outstanding_;
};

}  // namespace tsap
