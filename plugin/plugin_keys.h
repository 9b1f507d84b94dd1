// The keys, entitlement names, values and log texts of the daemon's plug-in
// layer. Each text is spelled here once; everything else names the constant.
// The keys of the plug-in model itself are in model/plugin_keys.h.
#pragma once

namespace dr {

// Entitlements.
inline constexpr const char* kReplacePluginEntitlement = "com.corvel.developer.replace-plugin";
// A host's restriction: a rules dictionary the plug-ins it uses must satisfy.
inline constexpr const char* kAllowedPluginsEntitlement =
    "com.corvel.developer.dromon.allowedplugins";

// The extension point name of plug-ins admitted without the sandbox.
inline constexpr const char* kUnsandboxedExtensionPointName = "Effecta";

// Match rules.
inline constexpr const char* kEntitlementRulePrefix = "ENTITLEMENT:";
inline constexpr char kTypeOperatorMark = '?';
inline constexpr const char* kConformsOperator = "?UT-CONFORMS:";
inline constexpr const char* kIsOperator = "?UT-IS:";

// The service overlay sent when a plug-in is enabled for a host.
inline constexpr const char* kIPCServiceKey = "IPCService";
inline constexpr const char* kEnvironmentVariablesKey = "EnvironmentVariables";
inline constexpr const char* kBNBundlePackageTypeKey = "BNBundlePackageType";
inline constexpr const char* kIPCServicePackageType = "IPC!";

}  // namespace dr
