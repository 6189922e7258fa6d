// The D-Bus face of ZLKANetworkProtocol: interface com.kestro.ZLKAuthentication.ZLKANetworkProtocol
// with RequestMetadataForToken, RequestActivationForToken and ConfirmActivationForToken. Each takes
// one a{sv}, so that an absent key is an absent argument; wrong types and unknown keys are refused
// with InvalidArgs before the operation runs. Operation errors become
// com.kestro.ZLKAuthentication.Error.<Name> with the error's description as the message.
#pragma once

#include <memory>
#include <string>

#include "platform/bus/messaging.h"
#include "platform/values/error.h"

inline constexpr char kZLKAServiceName[] = "com.kestro.ZLKAuthentication.ZLKANetwork";
inline constexpr char kZLKAObjectPath[] = "/com/kestro/ZLKAuthentication/ZLKANetwork";
inline constexpr char kZLKAInterfaceName[] = "com.kestro.ZLKAuthentication.ZLKANetworkProtocol";
inline constexpr char kZLKAErrorPrefix[] = "com.kestro.ZLKAuthentication.Error.";

// The interface description made from ZLKANetworkProtocol (one shared instance).
std::shared_ptr<const platform::Interface> ZLKANetworkProtocolInterface();

// "com.kestro.ZLKAuthentication.Error.MissingEntitlement" and so on, by code.
platform::BusError busErrorForError(const platform::Error& error);
