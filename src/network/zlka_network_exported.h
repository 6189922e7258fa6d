// ZLKANetworkExported: the one object exported on every connection. It holds nothing and forwards
// each call unchanged, on the calling thread, to the shared ZLKANetwork fetched anew every time.
#pragma once

#include "network/zlka_network_protocol.h"

class ZLKANetworkExported final : public ZLKANetworkProtocol {
 public:
  void requestMetadataForToken(const std::optional<platform::Data>& token, const std::optional<std::string>& uuid,
                               const std::optional<platform::Locale>& requestedLocale,
                               const std::optional<platform::Dictionary>& requestInfo,
                               ZLKAMetadataReply reply) override;
  void requestActivationForToken(const std::optional<platform::Data>& token, const std::optional<std::string>& uuid,
                                 ZLKAActivationReply reply) override;
  void confirmActivationForToken(const std::optional<platform::Data>& token, const std::optional<std::string>& uuid,
                                 ZLKAConfirmationReply reply) override;
};
