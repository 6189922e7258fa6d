#include "sap/tarvex_sap_primitives.h"

TarvexSAPPrimitives TarvexSAPPrimitives::library() {
  return {TarvexSAPInit, TarvexSAPExchange, TarvexSAPSign, TarvexSAPVerify, TarvexSAPTeardown};
}
