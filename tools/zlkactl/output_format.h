// What zlkactl prints. Each text ends with a line feed.
//
//   metadata   ppid: P / locale: L / metadata: <pretty JSON>    --json {"locale":L,"metadata":{...},"ppid":P}
//   activate   token: <hex> / length: N bytes                   --json {"length":N,"token_base64":B,"token_hex":H}
//   confirm    confirmed                                        --json {"confirmed":true}
//   failures   zlkactl: <domain> <code>: <description>         (on standard error)
#pragma once

#include <string>

#include "client/reply_decoding.h"
#include "platform/error.h"

namespace zlkactl {

std::string formatMetadata(const zlka_client::MetadataReply& reply, bool json);
std::string formatActivation(const platform::Data& token, bool json);
std::string formatConfirmation(bool json);
std::string formatError(const platform::Error& error);

// Any value as JSON text, scalars included ("x" with its quotes, 3, true).
std::string jsonText(const platform::Value& value, bool pretty);

}  // namespace zlkactl
