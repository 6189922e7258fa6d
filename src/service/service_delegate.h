// ServiceDelegate: admits every connection, exporting the one ZLKANetworkExported object through
// the ZLKANetworkProtocol interface. Callers are checked inside each operation, not here.
#pragma once

#include "platform/listener/listener.h"

class ServiceDelegate final : public platform::ListenerDelegate {
 public:
  bool listenerShouldAcceptNewConnection(platform::Listener& listener, platform::Connection& connection) override;
};
