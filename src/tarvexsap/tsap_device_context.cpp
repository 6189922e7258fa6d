#include "tarvexsap/tsap_device_context.h"

#include <algorithm>
#include <limits>

#include "tarvexsap/tsap_certificate_check.h"

namespace tsap {

int32_t DeviceContext::exchange(const TarvexHWInfo_& hwInfo, Bytes in, RequestBytes& request, bool& produced,
                                uint8_t& returnCode) {
  produced = false;
  int32_t status = kTarvexSAPErrorWrongState;
  if (state_ == State::awaitingCertificate) {
    status = acceptCertificate(hwInfo, in, request);
    if (status == kTarvexSAPOK) {
      state_ = State::awaitingSessionInfo;
      produced = true;
      returnCode = 1;
    }
  } else if (state_ == State::awaitingSessionInfo) {
    status = acceptSessionInfo(in);
    if (status == kTarvexSAPOK) {
      state_ = State::associated;
      returnCode = 0;
    }
  } else {
    return status;  // out of sequence: the context stays as it is
  }
  if (status != kTarvexSAPOK) {
    // A failed handshake is not resumable; the caller tears the context down.
    erase();
    state_ = State::failed;
  }
  return status;
}

int32_t DeviceContext::acceptCertificate(const TarvexHWInfo_& hwInfo, Bytes certificate, RequestBytes& request) {
  const int32_t status = acceptSetupCertificate(*config_, certificate, serverKey_);
  if (status != kTarvexSAPOK) {
    return status;
  }
  HandshakeRequest fields;
  fields.idLength = static_cast<uint8_t>(hwInfo.IDLength);
  std::copy_n(hwInfo.ID, hwInfo.IDLength, fields.id.begin());
  ephemeral_ = x25519Generate(fields.clientPublic);
  if (!ephemeral_ || !randomBytes(clientNonce_)) {
    return kTarvexSAPErrorCryptoFailure;
  }
  fields.clientNonce = clientNonce_;
  request_ = encodeRequest(fields);
  request = request_;
  return kTarvexSAPOK;
}

int32_t DeviceContext::acceptSessionInfo(Bytes bytes) {
  SessionInfo info;
  if (!parseSessionInfo(bytes, info)) {
    return kTarvexSAPErrorMalformedMessage;
  }
  SessionInfoBytes infoBytes{};
  std::copy(bytes.begin(), bytes.end(), infoBytes.begin());
  Digest t{};
  if (!transcriptHash(request_, infoBytes, t)) {
    return kTarvexSAPErrorCryptoFailure;
  }
  if (!ed25519Verify(serverKey_.get(), t, info.signature)) {
    return kTarvexSAPErrorSignatureInvalid;
  }
  Secret<32> z;
  if (!x25519Derive(ephemeral_.get(), info.serverPublic, z)) {
    return kTarvexSAPErrorMalformedMessage;  // low-order or unusable server key
  }
  ephemeral_.reset();
  serverKey_.reset();
  if (!deriveSessionKeys(z, clientNonce_, info.serverNonce, t, keys_)) {
    return kTarvexSAPErrorCryptoFailure;
  }
  return kTarvexSAPOK;
}

int32_t DeviceContext::sign(Bytes data, SignatureBytes& signature) {
  if (state_ != State::associated) {
    return kTarvexSAPErrorWrongState;
  }
  if (lastSeq_ == std::numeric_limits<uint64_t>::max()) {
    return kTarvexSAPErrorWrongState;  // counter exhausted: a new association is needed
  }
  const uint64_t seq = lastSeq_ + 1;
  if (!signMessage(keys_, Direction::request, seq, data, signature)) {
    return kTarvexSAPErrorCryptoFailure;
  }
  lastSeq_ = seq;
  outstanding_.add(seq);
  return kTarvexSAPOK;
}

int32_t DeviceContext::verify(Bytes signature, Bytes data) {
  if (state_ != State::associated) {
    return kTarvexSAPErrorWrongState;
  }
  if (signature.size() != kSignatureSize) {
    return kTarvexSAPErrorMalformedMessage;
  }
  uint64_t seq = 0;
  if (!checkMessage(keys_, Direction::response, signature, data, seq) || !outstanding_.take(seq)) {
    return kTarvexSAPErrorSignatureInvalid;
  }
  return kTarvexSAPOK;
}

void DeviceContext::tearDown() {
  erase();
  state_ = State::tornDown;
}

void DeviceContext::erase() {
  keys_.clear();
  ephemeral_.reset();
  serverKey_.reset();
  OPENSSL_cleanse(clientNonce_.data(), clientNonce_.size());
  OPENSSL_cleanse(request_.data(), request_.size());
  outstanding_.clear();
}

}  // namespace tsap
