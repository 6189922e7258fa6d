// The developer settings suite, its keys, and the notification name published with them.
#pragma once

inline constexpr char ZLKAUserDefaultsDomain[] = "com.kestro.ZLKAuthentication";
inline constexpr char ZLKAUserDefaultsKey_StaticContentServer[] = "StaticContentServer";
inline constexpr char ZLKAUserDefaultsKey_TarvexSAPServer[] = "TarvexSAPServer";
inline constexpr char ZLKAUserDefaultsKey_Server[] = "Server";
inline constexpr char ZLKAUserDefaultsKey_CustomServer[] = "CustomServer";
inline constexpr char ZLKAUserDefaultsKey_ForceNetworkFailure[] = "ForceNetworkFailure";
inline constexpr char ZLKAUserDefaultsKey_ForceTokenActivationFailure[] = "ForceTokenActivationFailure";
inline constexpr char ZLKAUserDefaultsKey_ForceTokenConfirmationFailure[] = "ForceTokenConfirmationFailure";
inline constexpr char ZLKAUserDefaultsKey_ForceTarvexSAPFailure[] = "ForceTarvexSAPFailure";
// Every key above that the daemon reads: zlkactl refuses to write any other without --force.
inline constexpr const char* ZLKAUserDefaultsKeys[] = {
    ZLKAUserDefaultsKey_Server,
    ZLKAUserDefaultsKey_CustomServer,
    ZLKAUserDefaultsKey_StaticContentServer,
    ZLKAUserDefaultsKey_TarvexSAPServer,
    ZLKAUserDefaultsKey_ForceNetworkFailure,
    ZLKAUserDefaultsKey_ForceTokenActivationFailure,
    ZLKAUserDefaultsKey_ForceTokenConfirmationFailure,
    ZLKAUserDefaultsKey_ForceTarvexSAPFailure,
};
inline constexpr char ZLKAUserDefaultsNotification[] = "com.kestro.ZLKAuthentication.PreferencesDidChangeNotification";

// The entitlement callers must hold, and the category in it that admits them.
inline constexpr char ZLKAEntitlement[] = "com.kestro.ZLKAuthentication";
inline constexpr char ZLKAEntitlementCategoryTokenAuth[] = "token-auth";
