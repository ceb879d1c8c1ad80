#pragma once

#include <cstdint>
#include <string_view>

/// Every name and number that the daemon and its peers have to agree on.
namespace zembra {

/// The named service of the daemon, unless it is told another name.
inline constexpr const char* serviceName = "com.nordane.zembra.zbd";

/// Posted without payload when annotations or holds change and when the daemon stops.
inline constexpr const char* annotationChangeNotification = "com.nordane.zembra.annotation-change";

/// Where the user's preferences live, and the preference that lists the excluded plug-ins.
inline constexpr const char* preferencesDomain = "com.nordane.zembra.userprefs";
inline constexpr const char* exclusionsPreference = "exclusions";

/// Class of the tokens that let a host look up a plug-in's service.
inline constexpr const char* serviceExtensionClass = "com.nordane.zembra.plugin-service";

/// Domain of the system's own errors; the codes are in `code`.
inline constexpr const char* errorDomain = "Zembra";

namespace requestType {
inline constexpr std::string_view add = "add";
inline constexpr std::string_view remove = "remove";
inline constexpr std::string_view bulk = "bulk";
inline constexpr std::string_view match = "match";
inline constexpr std::string_view ready = "ready";
inline constexpr std::string_view access = "access";
inline constexpr std::string_view annotate = "annotate";
inline constexpr std::string_view bulkAnnotate = "bulk-annotate";
inline constexpr std::string_view lock = "lock";
inline constexpr std::string_view find = "find";
} // namespace requestType

/// Keys of requests and replies.
namespace key {
inline constexpr std::string_view request = "request";
inline constexpr std::string_view version = "version";
inline constexpr std::string_view errorcode = "errorcode";
inline constexpr std::string_view error = "error";
inline constexpr std::string_view paths = "paths";
inline constexpr std::string_view uuids = "uuids";
inline constexpr std::string_view flags = "flags";
inline constexpr std::string_view rules = "rules";
inline constexpr std::string_view environment = "environment";
inline constexpr std::string_view annotations = "annotations";
inline constexpr std::string_view matches = "matches";
inline constexpr std::string_view extensions = "extensions";
inline constexpr std::string_view conflicts = "conflicts";
} // namespace key

/// Keys of a rules dictionary that name something other than an attribute or a manifest entry.
namespace ruleKey {
inline constexpr std::string_view entitlementPrefix = "ENTITLEMENT:";
inline constexpr std::string_view identifier = "VKExtensionIdentifier";
inline constexpr std::string_view uuid = "com.nordane.uuid";
inline constexpr std::string_view userElection = "VKUserElection";
inline constexpr std::string_view containingApp = "VKExtensionContainingApp";
} // namespace ruleKey

/// Keys of an annotation.
namespace annotationKey {
inline constexpr std::string_view election = "election";
inline constexpr std::string_view extension = "extension";
} // namespace annotationKey

/// Keys of a plug-in form: the dictionary by which one plug-in travels in a reply.
namespace formKey {
inline constexpr std::string_view hubProtocolVersion = "hubProtocolVersion";
inline constexpr std::string_view path = "path";
inline constexpr std::string_view systemResident = "systemResident";
inline constexpr std::string_view identifier = "identifier";
inline constexpr std::string_view originalIdentifier = "original-identifier";
inline constexpr std::string_view version = "version";
inline constexpr std::string_view bundleInfo = "bundleInfo";
inline constexpr std::string_view info = "info";
inline constexpr std::string_view uuid = "uuid";
inline constexpr std::string_view lastModified = "lastmodified";
inline constexpr std::string_view annotations = "annotations";
inline constexpr std::string_view entitlements = "entitlements";
inline constexpr std::string_view containingPath = "containingPath";
inline constexpr std::string_view localizedContainingName = "localizedContainingDisplayName";
inline constexpr std::string_view localizedName = "localizedDisplayName";
inline constexpr std::string_view localizedShortName = "localizedShortName";
inline constexpr std::string_view localizedFilevaneActionNames = "localizedFilevaneActionNames";
// Read from a form, never written into one.
inline constexpr std::string_view hash = "hash";
inline constexpr std::string_view requirement = "requirement";
// Added to a form before it is sent.
inline constexpr std::string_view extensions = "extensions";
inline constexpr std::string_view serviceExtension = "service-extension";
inline constexpr std::string_view overrider = "overrider";
inline constexpr std::string_view overriding = "overriding";
} // namespace formKey

/// Codes of error replies and of errors in the system's own domain.
namespace code {
inline constexpr std::int64_t unresolvable = -1; // localized information that cannot be given; never sent
inline constexpr std::int64_t registrationFailed = 2;
inline constexpr std::int64_t malformed = 4; // also an unknown plug-in, a failed preparation, a failed transport
inline constexpr std::int64_t interfaceDescription = 6; // never sent
inline constexpr std::int64_t version = 7;
inline constexpr std::int64_t badPath = 9;
inline constexpr std::int64_t notPermitted = 11;
inline constexpr std::int64_t configuration = 12; // also an interface that cannot be found or made; never sent
inline constexpr std::int64_t busy = 14;
inline constexpr std::int64_t notFound = 15;
inline constexpr std::int64_t bulkAnnotation = 18;
} // namespace code

inline constexpr std::int64_t currentVersion = 3;

/// Version 2 requesters are served too, but get no "matches": they cannot read its encoding.
constexpr bool isSupportedVersion(std::uint64_t version) { return (version & ~std::uint64_t{1}) == 2; }

/// Flags of "match".
enum DiscoveryFlags : std::uint64_t {
    ZBDiscoverAllVersions = 0x1, // keep every version of an identifier
    ZBDiscoverDuplicates = 0x4,  // with the flag above: keep equal versions too
    ZBDiscoverSystemOnly = 0x8,  // only plug-ins on the system volume
    ZBDiscoverAll = 0x200,       // without the host-side filters; privileged
};

/// Flags of "lock".
enum LockFlags : std::uint64_t {
    ZBLockPlugInPaths = 0x1,    // the paths name plug-ins, not applications
    ZBLockRefuseWhenBusy = 0x2, // no hold while any of the plug-ins is busy
    ZBLockTerminate = 0x4,      // end running instances before the hold is granted
};

namespace entitlement {
// Of hosts.
inline constexpr std::string_view manager = "com.nordane.private.zembra.manager";
inline constexpr std::string_view allowedPlugIns = "com.nordane.developer.zembra.allowedplugins";
inline constexpr std::string_view provideEnvironment = "com.nordane.developer.zembra.provide-environment";
// Of plug-ins.
inline constexpr std::string_view replacePlugIn = "com.nordane.developer.replace-plugin";
inline constexpr std::string_view autoElectPlugIn = "com.nordane.developer.auto-elect-plugin";
} // namespace entitlement

} // namespace zembra
