#include "network/zlka_network_exported.h"

#include "network/zlka_network.h"

void ZLKANetworkExported::requestMetadataForToken(const std::optional<platform::Data>& token,
                                                  const std::optional<std::string>& uuid,
                                                  const std::optional<platform::Locale>& requestedLocale,
                                                  const std::optional<platform::Dictionary>& requestInfo,
                                                  ZLKAMetadataReply reply) {
  ZLKANetwork::sharedInstance()->requestMetadataForToken(token, uuid, requestedLocale, requestInfo, std::move(reply));
}

void ZLKANetworkExported::requestActivationForToken(const std::optional<platform::Data>& token,
                                                    const std::optional<std::string>& uuid, ZLKAActivationReply reply) {
  ZLKANetwork::sharedInstance()->requestActivationForToken(token, uuid, std::move(reply));
}

void ZLKANetworkExported::confirmActivationForToken(const std::optional<platform::Data>& token,
                                                    const std::optional<std::string>& uuid,
                                                    ZLKAConfirmationReply reply) {
  ZLKANetwork::sharedInstance()->confirmActivationForToken(token, uuid, std::move(reply));
}
