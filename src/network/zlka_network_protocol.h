// ZLKANetworkProtocol: the three token operations the service exports. Each calls its reply
// exactly once: on success with its values and no error, on failure with no values and an error
// of ZLKATokenManagerErrorDomain. The codes common to all three: -2 when the calling connection
// lacks the "token-auth" category of the service's entitlement, -3 for a missing argument, token
// data that does not parse or a 400 answer, -4 when the request cannot be made or signed, the
// answer's signature cannot be checked in time, or a 401 answer, -5 for a transport failure (or a
// forced one), -6 for any other status or an answer whose signature or content is wrong.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "platform/config/locale.h"
#include "platform/values/data.h"
#include "platform/values/error.h"
#include "platform/values/value.h"

using ZLKAMetadataReply =
    std::function<void(std::optional<std::string> ppid, std::optional<platform::Locale> locale,
                       std::optional<platform::Dictionary> metadata, std::optional<platform::Error> error)>;
using ZLKAActivationReply =
    std::function<void(std::optional<platform::Data> newToken, std::optional<platform::Error> error)>;
using ZLKAConfirmationReply = std::function<void(std::optional<platform::Error> error)>;

class ZLKANetworkProtocol {
 public:
  virtual ~ZLKANetworkProtocol() = default;
  // requestMetadataForToken replies with the product-plan identifier of `token`, the locale of the
  // answer and the plan's metadata in it. An unavailable `requestedLocale` is -3; `requestInfo`
  // goes to the server as "request_info", and one that JSON cannot hold is -4; an answer without a
  // ppid, an available locale and a metadata dictionary is -6.
  virtual void requestMetadataForToken(const std::optional<platform::Data>& token,
                                       const std::optional<std::string>& uuid,
                                       const std::optional<platform::Locale>& requestedLocale,
                                       const std::optional<platform::Dictionary>& requestInfo,
                                       ZLKAMetadataReply reply) = 0;
  // requestActivationForToken replies with the token the server issues for `token` on the
  // accessory `uuid`: the concatenation of the answer's two base64 pieces (-6 unless two strings).
  virtual void requestActivationForToken(const std::optional<platform::Data>& token,
                                         const std::optional<std::string>& uuid, ZLKAActivationReply reply) = 0;
  // confirmActivationForToken replies with no error once the server has acknowledged the
  // activation of `token` on `uuid` (status 200 or 204).
  virtual void confirmActivationForToken(const std::optional<platform::Data>& token,
                                         const std::optional<std::string>& uuid, ZLKAConfirmationReply reply) = 0;
};
