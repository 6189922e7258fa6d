// The five primitive calls the session makes, as a replaceable table. The default table is the
// TSAP1 library; tests substitute scripted functions. Statuses are 0 for success; output buffers
// are malloc'ed and become the caller's.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>

#include "tarvexsap/tarvex_sap.h"

struct TarvexSAPPrimitives {
  std::function<int32_t(QVSAPContextOpaque_** context, TarvexHWInfo_* hwInfo)> init;
  std::function<int32_t(int32_t selector, TarvexHWInfo_* hwInfo, QVSAPContextOpaque_* context, const uint8_t* in,
                        size_t inLength, uint8_t** out, uint32_t* outLength, uint8_t* returnCode)>
      exchange;
  std::function<int32_t(QVSAPContextOpaque_* context, const uint8_t* data, size_t length, uint8_t** signature,
                        uint32_t* signatureLength)>
      sign;
  std::function<int32_t(QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLength, uint8_t* data,
                        size_t length)>
      verify;
  std::function<int32_t(QVSAPContextOpaque_* context)> teardown;

  // TarvexSAPInit, TarvexSAPExchange, TarvexSAPSign, TarvexSAPVerify and TarvexSAPTeardown.
  static TarvexSAPPrimitives library();
};

// The exchange selector the session always passes.
inline constexpr int32_t kTarvexSAPExchangeSelector = 200;
