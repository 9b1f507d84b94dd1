// The keys of plug-in information dictionaries, SDK dictionaries and forms,
// the fixed values the plug-in record fills in, and the entitlement names,
// match-rule operators and service overlay keys of the plug-in layer. Each
// text is spelled here once; everything else names the constant.
#pragma once

#include <array>

namespace dr {

// The bundle's information dictionary.
inline constexpr const char* kUXExtensionKey = "UXExtension";  // the top dictionary
inline constexpr const char* kDromonKey = "Dromon";            // the top dictionary, old style
inline constexpr const char* kBNBundleVersionKey = "BNBundleVersion";
inline constexpr const char* kBNBundleInfoPdocURLKey = "BNBundleInfoPdocURL";
inline constexpr const char* kBNBundleIdentifierKey = "BNBundleIdentifier";

// The top dictionary.
inline constexpr const char* kMultipleKey = "Multiple";  // plug-in identifier → its dictionary
inline constexpr const char* kHubProtocolVersionKey = "HubProtocolVersion";

// A plug-in's own dictionary.
inline constexpr const char* kUXExtensionAttributesKey = "UXExtensionAttributes";
inline constexpr const char* kUXExtensionPointIdentifierKey = "UXExtensionPointIdentifier";
inline constexpr const char* kUXExtensionProtocolKey = "UXExtensionProtocol";
inline constexpr const char* kPrincipalClassKey = "PrincipalClass";
inline constexpr const char* kEmbeddedCodeKey = "EmbeddedCode";
inline constexpr const char* kEmbeddedProtocolKey = "EmbeddedProtocol";
inline constexpr const char* kDedicatedKey = "Dedicated";
inline constexpr const char* kPassProxyKey = "PassProxy";
inline constexpr const char* kSharedKey = "Shared";
inline constexpr const char* kCleanTimeoutKey = "CleanTimeout";
inline constexpr const char* kUXExtensionHostEntitlementKey = "UXExtensionHostEntitlement";

// The attributes dictionary.
inline constexpr const char* kUXExtensionIdentifierKey = "UXExtensionIdentifier";
inline constexpr const char* kUXExtensionPointNameKey = "UXExtensionPointName";
inline constexpr const char* kUXExtensionVersionKey = "UXExtensionVersion";
inline constexpr const char* kFormatAttributeKey = "com.corvel.format";

// The match-rule key that stands for a record's UUID.
inline constexpr const char* kUuidRuleKey = "com.corvel.uuid";

// Old-style keys of the top dictionary and of its attributes.
inline constexpr const char* kOldAttributesKey = "Attributes";
inline constexpr const char* kOldProtocolKey = "Protocol";
inline constexpr const char* kOldSdkKey = "SDK";
inline constexpr const char* kOldIdentifierAttributeKey = "com.corvel.identifier";
inline constexpr const char* kOldProtocolAttributeKey = "com.corvel.protocol";
inline constexpr const char* kOldVersionAttributeKey = "com.corvel.version";

// Values.
inline constexpr const char* kDefaultProtocolAndClass = "UXObject";
inline constexpr const char* kAppExtensionSharedPath = ".";
inline constexpr const char* kStandardFormat = "standard";
inline constexpr const char* kHybridFormat = "hybrid";
inline constexpr const char* kLastResortVersion = "1";
inline constexpr const char* kDataProtocol = "#Data";
inline constexpr const char* kAppExtensionSuffix = ".appex";
// Names a folder searched for SDK dictionaries before the registered ones;
// passed on to every plug-in service the daemon enables.
inline constexpr const char* kTestSdkEnvironmentVariable = "DRTEST_SDK";

// The form of a plug-in record.
inline constexpr const char* kFormHubProtocolVersionKey = "hubProtocolVersion";
inline constexpr const char* kFormPathKey = "path";
inline constexpr const char* kFormSystemResidentKey = "systemResident";
inline constexpr const char* kFormIdentifierKey = "identifier";
inline constexpr const char* kFormVersionKey = "version";
inline constexpr const char* kFormBundleInfoKey = "bundleInfo";
inline constexpr const char* kFormInfoKey = "info";
inline constexpr const char* kFormUuidKey = "uuid";
inline constexpr const char* kFormLastModifiedKey = "lastmodified";
inline constexpr const char* kFormAnnotationsKey = "annotations";
inline constexpr const char* kFormContainingPathKey = "containingPath";
inline constexpr const char* kFormLocalizedContainingNameKey = "localizedContainingDisplayName";
inline constexpr const char* kFormLocalizedNameKey = "localizedDisplayName";
inline constexpr const char* kFormLocalizedShortNameKey = "localizedShortName";
inline constexpr const char* kFormHashKey = "hash";
inline constexpr const char* kFormRequirementKey = "requirement";
inline constexpr const char* kFormExtensionsKey = "extensions";
inline constexpr const char* kFormOverriderKey = "overrider";
inline constexpr const char* kFormOverridingKey = "overriding";
// The entries a "match" adds to a record's form, in ascending order.
inline constexpr std::array<const char*, 4> kFormRequestKeys = {
    kFormAnnotationsKey, kFormExtensionsKey, kFormOverriderKey, kFormOverridingKey};

// Entitlements, match rules and the service overlay.
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
