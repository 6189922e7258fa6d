// Reading the daemon's answers: the out arguments of each method, checked against the signature it
// promises. An answer of another form is a MalformedReply client error.
#pragma once

#include <systemd/sd-bus.h>

#include <string>

#include "client/result.h"
#include "platform/values/data.h"
#include "platform/values/value.h"

namespace zlka_client {

// RequestMetadataForToken answers "sss": ppid, locale identifier, metadata as compact JSON text.
struct MetadataReply {
  std::string ppid;
  std::string locale;
  platform::Value metadata;  // the JSON text parsed (an object or an array)
};

// ConfirmActivationForToken answers with nothing.
struct Confirmation {};

// decodeMetadataReply reads "sss" and parses the metadata JSON; MalformedReply when the reply has
// another form or the text is not JSON. `reply` is borrowed.
Result<MetadataReply> decodeMetadataReply(sd_bus_message* reply);
// decodeActivationReply reads "ay", the new token; MalformedReply otherwise.
Result<platform::Data> decodeActivationReply(sd_bus_message* reply);
// decodeConfirmationReply succeeds for an empty reply; MalformedReply otherwise.
Result<Confirmation> decodeConfirmationReply(sd_bus_message* reply);
// Any answer: each out argument read as a Value (variants unwrapped, byte arrays as Data).
Result<platform::Array> decodeAnyReply(sd_bus_message* reply);

}  // namespace zlka_client
