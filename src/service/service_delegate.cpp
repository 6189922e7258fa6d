#include "service/service_delegate.h"

#include "network/zlka_network.h"
#include "service/zlka_network_bus_interface.h"

bool ServiceDelegate::listenerShouldAcceptNewConnection(platform::Listener&, platform::Connection& connection) {
  connection.setExportedInterface(ZLKANetworkProtocolInterface());
  // The first connection makes the shared ZLKANetwork.
  connection.setExportedObject(ZLKANetwork::sharedInstance()->exportedObject());
  connection.resume();
  return true;
}
