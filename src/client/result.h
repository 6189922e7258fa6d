// Result<T>: the value of a successful call, or the platform::Error it failed with.
#pragma once

#include "platform/values/error.h"
#include "platform/values/result.h"

namespace zlka_client {

template <class T>
using Result = platform::Result<T, platform::Error>;

}  // namespace zlka_client
