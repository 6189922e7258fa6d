// The device entry points: argument checks, handle look-up, buffer hand-over. The protocol
// itself lives in DeviceContext.
#include "tarvexsap/tarvex_sap.h"

#include <cstdlib>
#include <cstring>
#include <new>

#include "tarvexsap/tsap_device_config.h"
#include "tarvexsap/tsap_device_context.h"
#include "tarvexsap/tsap_registry.h"

using tsap::DeviceContext;

namespace {

// Copies bytes into a malloc'd buffer the caller owns.
template <std::size_t N>
uint8_t* handOver(const std::array<uint8_t, N>& bytes) {
  auto* buffer = static_cast<uint8_t*>(std::malloc(N));
  if (buffer != nullptr) {
    std::memcpy(buffer, bytes.data(), N);
  }
  return buffer;
}

// Runs `call` on the live context behind `handle`, under its lock; a handle that is not registered,
// or whose context a teardown got to first, is unknown.
template <class Call>
int32_t withLiveContext(QVSAPContextOpaque_* handle, Call call) {
  const auto ctx = tsap::findContext(handle);
  if (!ctx) {
    return kTarvexSAPErrorUnknownHandle;
  }
  std::lock_guard lock(ctx->mutex);
  if (ctx->state() == DeviceContext::State::tornDown) {
    return kTarvexSAPErrorUnknownHandle;
  }
  return call(*ctx);
}

}  // namespace

const char* TarvexSAPStatusName(int32_t status) {
  switch (status) {
    case kTarvexSAPOK:
      return "kTarvexSAPOK";
    case kTarvexSAPErrorBadArgument:
      return "kTarvexSAPErrorBadArgument";
    case kTarvexSAPErrorWrongState:
      return "kTarvexSAPErrorWrongState";
    case kTarvexSAPErrorUnknownHandle:
      return "kTarvexSAPErrorUnknownHandle";
    case kTarvexSAPErrorCertificateRejected:
      return "kTarvexSAPErrorCertificateRejected";
    case kTarvexSAPErrorMalformedMessage:
      return "kTarvexSAPErrorMalformedMessage";
    case kTarvexSAPErrorSignatureInvalid:
      return "kTarvexSAPErrorSignatureInvalid";
    case kTarvexSAPErrorCryptoFailure:
      return "kTarvexSAPErrorCryptoFailure";
    case kTarvexSAPErrorNotConfigured:
      return "kTarvexSAPErrorNotConfigured";
    default:
      return "unknown";
  }
}

int32_t TarvexSAPConfigure(const TarvexSAPConfig* config) { return tsap::configureDevice(config); }

int32_t TarvexSAPInit(QVSAPContextOpaque_** context, TarvexHWInfo_* hwInfo) {
  if (context == nullptr || hwInfo == nullptr || hwInfo->IDLength > tsap::kHardwareIDMax) {
    return kTarvexSAPErrorBadArgument;
  }
  auto config = tsap::currentDeviceConfig();
  if (!config) {
    return kTarvexSAPErrorNotConfigured;
  }
  if (hwInfo->IDLength == 0) {
    std::array<uint8_t, tsap::kHardwareIDMax> id{};
    if (!tsap::hardwareIDFromMachineID(config->machineIDPath, id)) {
      return kTarvexSAPErrorCryptoFailure;
    }
    std::memcpy(hwInfo->ID, id.data(), id.size());
    hwInfo->IDLength = static_cast<uint32_t>(id.size());
  }
  std::shared_ptr<DeviceContext> fresh;
  try {
    fresh = std::make_shared<DeviceContext>(std::move(config));
  } catch (const std::bad_alloc&) {
    return kTarvexSAPErrorCryptoFailure;
  }
  QVSAPContextOpaque_* handle = tsap::registerContext(std::move(fresh));
  if (handle == nullptr) {
    return kTarvexSAPErrorCryptoFailure;
  }
  *context = handle;
  return kTarvexSAPOK;
}

int32_t TarvexSAPExchange(int32_t selector, TarvexHWInfo_* hwInfo, QVSAPContextOpaque_* context, const uint8_t* in,
                          size_t inLen, uint8_t** out, uint32_t* outLen, uint8_t* returnCode) {
  if (selector != tsap::kExchangeSelector || hwInfo == nullptr || hwInfo->IDLength > tsap::kHardwareIDMax ||
      context == nullptr || (in == nullptr && inLen != 0) || out == nullptr || outLen == nullptr ||
      returnCode == nullptr) {
    return kTarvexSAPErrorBadArgument;
  }
  return withLiveContext(context, [&](DeviceContext& ctx) {
    tsap::RequestBytes request{};
    bool produced = false;
    uint8_t code = 0;
    const int32_t status = ctx.exchange(*hwInfo, tsap::bytesOf(in, inLen), request, produced, code);
    if (status != kTarvexSAPOK) {
      return status;
    }
    if (produced) {
      uint8_t* buffer = handOver(request);
      if (buffer == nullptr) {
        return kTarvexSAPErrorCryptoFailure;
      }
      *out = buffer;
      *outLen = static_cast<uint32_t>(request.size());
    }
    *returnCode = code;
    return kTarvexSAPOK;
  });
}

int32_t TarvexSAPSign(QVSAPContextOpaque_* context, const uint8_t* data, size_t len, uint8_t** signature,
                      uint32_t* signatureLen) {
  if (context == nullptr || (data == nullptr && len != 0) || signature == nullptr || signatureLen == nullptr) {
    return kTarvexSAPErrorBadArgument;
  }
  return withLiveContext(context, [&](DeviceContext& ctx) {
    tsap::SignatureBytes bytes{};
    const int32_t status = ctx.sign(tsap::bytesOf(data, len), bytes);
    if (status != kTarvexSAPOK) {
      return status;
    }
    uint8_t* buffer = handOver(bytes);
    if (buffer == nullptr) {
      return kTarvexSAPErrorCryptoFailure;
    }
    *signature = buffer;
    *signatureLen = static_cast<uint32_t>(bytes.size());
    return kTarvexSAPOK;
  });
}

int32_t TarvexSAPVerify(QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLen, uint8_t* data,
                        size_t len) {
  if (context == nullptr || (signature == nullptr && signatureLen != 0) || (data == nullptr && len != 0)) {
    return kTarvexSAPErrorBadArgument;
  }
  return withLiveContext(context, [&](DeviceContext& ctx) {
    return ctx.verify(tsap::bytesOf(signature, signatureLen), tsap::bytesOf(data, len));
  });
}

int32_t TarvexSAPTeardown(QVSAPContextOpaque_* context) {
  if (context == nullptr) {
    return kTarvexSAPErrorBadArgument;
  }
  const auto ctx = tsap::unregisterContext(context);
  if (!ctx) {
    return kTarvexSAPErrorUnknownHandle;
  }
  // Waits for a call already running on this context, then erases; the memory goes with the
  // last reference.
  std::lock_guard lock(ctx->mutex);
  ctx->tearDown();
  return kTarvexSAPOK;
}
