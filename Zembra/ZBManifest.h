#pragma once

#include <string_view>

/// The keys of a bundle's manifest (its Info.vlist) that mean something to the system.
namespace zembra::manifest {

// Of the manifest itself.
inline constexpr std::string_view extension = "VKExtension"; // the plug-in dictionary
inline constexpr std::string_view zembra = "Zembra";         // its older style
inline constexpr std::string_view bundleIdentifier = "VBBundleIdentifier";
inline constexpr std::string_view bundleDisplayName = "VBBundleDisplayName";
inline constexpr std::string_view bundleName = "VBBundleName";
inline constexpr std::string_view bundlePackageType = "VBBundlePackageType";
inline constexpr std::string_view bundleShortVersionString = "VBBundleShortVersionString";
inline constexpr std::string_view bundleVersion = "VBBundleVersion";
inline constexpr std::string_view qmxService = "QMXService"; // describes the plug-in as a service; see `service`
inline constexpr std::string_view bundleInfoVlistURL = "VBBundleInfoVlistURL";

// Of the plug-in dictionary.
inline constexpr std::string_view attributes = "VKExtensionAttributes";
inline constexpr std::string_view identifier = "VKExtensionIdentifier";
inline constexpr std::string_view protocol = "VKExtensionProtocol";
inline constexpr std::string_view pointIdentifier = "VKExtensionPointIdentifier";
inline constexpr std::string_view hostEntitlement = "VKExtensionHostEntitlement";
inline constexpr std::string_view filevaneActions = "VKExtensionFilevaneActions";
inline constexpr std::string_view filevaneActionName = "VKExtensionFilevaneActionName"; // of one action
inline constexpr std::string_view principalClass = "PrincipalClass";
inline constexpr std::string_view embeddedCode = "EmbeddedCode";
inline constexpr std::string_view embeddedProtocol = "EmbeddedProtocol";
inline constexpr std::string_view dedicated = "Dedicated";
inline constexpr std::string_view passProxy = "PassProxy";
inline constexpr std::string_view multiple = "Multiple";
inline constexpr std::string_view hubProtocolVersion = "HubProtocolVersion";
inline constexpr std::string_view shared = "Shared";
inline constexpr std::string_view cleanTimeout = "CleanTimeout";

// Of the attributes.
inline constexpr std::string_view version = "VKExtensionVersion";
inline constexpr std::string_view pointName = "VKExtensionPointName";
inline constexpr std::string_view requestsOpenAccess = "RequestsOpenAccess";

// Values.
inline constexpr std::string_view objectProtocol = "VKObject"; // protocol and principal class of an app extension
inline constexpr std::string_view dataProtocol = "#Data";      // a plug-in without code
inline constexpr std::string_view appExtensionSuffix = ".appex";

} // namespace zembra::manifest

/// The keys of a plug-in's service description.
namespace zembra::service {

inline constexpr std::string_view environmentVariables = "EnvironmentVariables";
// Set by the daemon for the service manager.
inline constexpr std::string_view sandboxProfile = "_SandboxProfile";
inline constexpr std::string_view omitSandboxParameters = "_OmitSandboxParameters";

} // namespace zembra::service
