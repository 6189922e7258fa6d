// Device side of the secure association (TSAP1): five plain functions over an opaque context.
//
//  TarvexSAPConfigure  once at start-up (again to replace it): trust anchor PEM and the
//                      machine-id file that seeds an empty hardware identifier. Null clears it.
//  TarvexSAPInit       new context; fills hwInfo from the machine id when IDLength is 0.
//  TarvexSAPExchange   selector 200. First call: setup certificate (DER, or PEM) in, 90-byte
//                      handshake request out, returnCode 1. Second call: 129-byte session
//                      info in, no output, returnCode 0: the association is complete.
//  TarvexSAPSign       40-byte signature of a request body.
//  TarvexSAPVerify     0 only for a valid, not yet used signature of a response to one of our
//                      requests.
//  TarvexSAPTeardown   erases the keys and frees the context.
//
// Every status is 0 or one of the negative kTarvexSAPError* values. Output buffers come from
// malloc and belong to the caller (free). Handles are registry tokens, never addresses: a
// torn-down or foreign handle is refused with kTarvexSAPErrorUnknownHandle and nothing is
// touched, so repeated teardown is harmless. A failed exchange leaves the context unusable
// (kTarvexSAPErrorWrongState) until it is torn down. One context must be used from one thread
// at a time; different contexts may be used from different threads concurrently.
#pragma once

#include <cstddef>
#include <cstdint>

struct QVSAPContextOpaque_;  // never defined: handles are opaque tokens

struct TarvexHWInfo_ {
  uint32_t IDLength;
  uint8_t ID[20];
};

struct TarvexSAPConfig {
  const uint8_t* trustAnchorPEM;  // one or more PEM certificates
  size_t trustAnchorPEMLength;
  const char* machineIDPath;  // null: /etc/machine-id
};

inline constexpr int32_t kTarvexSAPOK = 0;
inline constexpr int32_t kTarvexSAPErrorBadArgument = -1;          // null/oversized argument, selector not 200
inline constexpr int32_t kTarvexSAPErrorWrongState = -2;           // call not valid in the context's state
inline constexpr int32_t kTarvexSAPErrorUnknownHandle = -3;        // handle not live
inline constexpr int32_t kTarvexSAPErrorCertificateRejected = -4;  // unparsable, untrusted or unfit certificate
inline constexpr int32_t kTarvexSAPErrorMalformedMessage = -5;     // wrong length, version or peer key
inline constexpr int32_t kTarvexSAPErrorSignatureInvalid = -6;     // bad signature, replayed or foreign seq
inline constexpr int32_t kTarvexSAPErrorCryptoFailure = -7;        // the crypto library failed
inline constexpr int32_t kTarvexSAPErrorNotConfigured = -8;        // no trust anchor configured

// Short constant name of a status, for logs ("unknown" for values not listed above).
const char* TarvexSAPStatusName(int32_t status);

// TarvexSAPConfigure replaces the process's trust anchor and machine-id path (copied; `config` is
// not kept), or clears them when `config` is null. It returns BadArgument for an empty anchor and
// CertificateRejected when it holds no certificate or a broken PEM block, leaving the previous
// configuration in force.
// Contexts already made keep the configuration they started with.
int32_t TarvexSAPConfigure(const TarvexSAPConfig* config);
// TarvexSAPInit sets *context to a new context awaiting the setup certificate and, when
// hwInfo->IDLength is 0, fills *hwInfo from the machine id. It returns BadArgument for a null
// argument or an ID over 20 bytes, NotConfigured before TarvexSAPConfigure, and CryptoFailure when
// no identifier, memory or handle can be had; *context is written only on success.
int32_t TarvexSAPInit(QVSAPContextOpaque_** context, TarvexHWInfo_* hwInfo);
// TarvexSAPExchange runs the next handshake step (above). On success it sets *returnCode and, when
// the step produces output, *out (malloc'ed, the caller frees it) and *outLen. It returns
// BadArgument for a selector other than 200 or a null argument, UnknownHandle for a handle not
// live, WrongState out of turn, and CertificateRejected, MalformedMessage or CryptoFailure as the
// step fails; after a failed step the context only answers WrongState.
int32_t TarvexSAPExchange(int32_t selector, TarvexHWInfo_* hwInfo, QVSAPContextOpaque_* context, const uint8_t* in,
                          size_t inLen, uint8_t** out, uint32_t* outLen, uint8_t* returnCode);
// TarvexSAPSign sets *signature (40 bytes, malloc'ed, the caller frees it) and *signatureLen to the
// signature of the `len` bytes at `data` under the next sequence number. It returns BadArgument,
// UnknownHandle, WrongState before the association is complete or when the sequence numbers are
// spent, or CryptoFailure; the outputs are written only on success.
int32_t TarvexSAPSign(QVSAPContextOpaque_* context, const uint8_t* data, size_t len, uint8_t** signature,
                      uint32_t* signatureLen);
// TarvexSAPVerify returns 0 when `signature` signs the `len` bytes at `data` as the answer to a
// request this context signed and has not yet seen answered, and uses that sequence number up. It
// returns MalformedMessage for a signature not 40 bytes long, SignatureInvalid for a bad, replayed
// or foreign one, and BadArgument, UnknownHandle or WrongState as the other calls do. `data` is
// only read.
int32_t TarvexSAPVerify(QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLen, uint8_t* data,
                        size_t len);
// TarvexSAPTeardown waits for a call running on the context, erases its keys and retires the
// handle. It returns BadArgument for null and UnknownHandle for a handle not live.
int32_t TarvexSAPTeardown(QVSAPContextOpaque_* context);
