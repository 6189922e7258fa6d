// What zlkactl prints. Each text ends with a line feed.
//
//   metadata   ppid: P / locale: L / metadata: <pretty JSON>    --json {"locale":L,"metadata":{...},"ppid":P}
//   activate   token: <hex> / length: N bytes                   --json {"length":N,"token_base64":B,"token_hex":H}
//   confirm    confirmed                                        --json {"confirmed":true}
//   failures   zlkactl: <domain> <code>: <description>         --json {"code":C,"description":D,"domain":N}
//              zlkactl: <description>  (zlkactl's own)          (both on standard error)
#pragma once

#include <string>

#include "platform/values/value.h"
#include "zlka/client.h"

namespace zlkactl {

// The domain of zlkactl's own errors (usage, input, settings), whose code is the exit status.
inline constexpr char kToolErrorDomain[] = "zlkactl";

std::string formatMetadata(const zlka::Metadata& reply, bool json);
std::string formatActivation(const zlka::Bytes& token, bool json);
std::string formatConfirmation(bool json);
std::string formatError(const zlka::Error& error, bool json);

// toolError returns zlkactl's own error with `exitStatus` as its code.
zlka::Error toolError(int exitStatus, std::string description);

// Any value as JSON text, scalars included ("x" with its quotes, 3, true).
std::string jsonText(const platform::Value& value, bool pretty);

}  // namespace zlkactl
