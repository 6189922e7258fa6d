// ZLKANetworkProtocol: the three token operations the service exports. Each calls its reply
// exactly once: on success with its values and no error, on failure with no values and an error
// of ZLKATokenManagerErrorDomain.
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
  virtual void requestMetadataForToken(const std::optional<platform::Data>& token,
                                       const std::optional<std::string>& uuid,
                                       const std::optional<platform::Locale>& requestedLocale,
                                       const std::optional<platform::Dictionary>& requestInfo,
                                       ZLKAMetadataReply reply) = 0;
  virtual void requestActivationForToken(const std::optional<platform::Data>& token,
                                         const std::optional<std::string>& uuid, ZLKAActivationReply reply) = 0;
  virtual void confirmActivationForToken(const std::optional<platform::Data>& token,
                                         const std::optional<std::string>& uuid, ZLKAConfirmationReply reply) = 0;
};
