// Where the daemon lives on the bus and how its errors are named. These mirror the daemon's own
// definitions; the client keeps its copy so that it does not link the daemon.
#pragma once

namespace zlka_client {

inline constexpr char kServiceName[] = "com.kestro.ZLKAuthentication.ZLKANetwork";
inline constexpr char kObjectPath[] = "/com/kestro/ZLKAuthentication/ZLKANetwork";
inline constexpr char kInterfaceName[] = "com.kestro.ZLKAuthentication.ZLKANetworkProtocol";

inline constexpr char kMetadataMethod[] = "RequestMetadataForToken";
inline constexpr char kActivationMethod[] = "RequestActivationForToken";
inline constexpr char kConfirmationMethod[] = "ConfirmActivationForToken";

// An operation's failure travels as "<prefix><Name>", Name chosen by the error code.
inline constexpr char kOperationErrorPrefix[] = "com.kestro.ZLKAuthentication.Error.";

}  // namespace zlka_client
