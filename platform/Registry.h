#pragma once

#include "platform/PropertyList.h"
#include "platform/Transport.h"
#include "platform/Url.h"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

/// Catalix, the application registry: which applications and plug-ins are installed.
namespace platform {

struct ApplicationRecord;

/// One registered plug-in as the registry describes it: an immutable picture of the moment it was asked for.
struct PlugInProxy {
    std::optional<UUID> uuid;
    std::optional<URL> bundleURL;
    std::optional<std::string> plugInIdentifier; // "VKExtensionIdentifier" of the plug-in dictionary, else the bundle's
    std::optional<std::string> originalIdentifier; // the identifier under which the plug-in was first registered
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> bundleVersion;
    std::optional<Dictionary> plugInDictionary; // the manifest's "VKExtension", else its "Zembra" dictionary
    std::optional<Dictionary> infoDictionary;   // the whole manifest
    std::optional<Dictionary> entitlements;     // of the plug-in's executable
    std::optional<Date> registrationDate;
    bool onSystemPartition = false;
    std::optional<std::string> localizedName;
    std::optional<std::string> localizedShortName;
    std::optional<URL> dataContainerURL;
    std::shared_ptr<const ApplicationRecord> containingBundle; // the application around it, if any

    std::string description() const;
};
using PlugInProxyRef = std::shared_ptr<const PlugInProxy>;
/// An answer of the registry, shared with whoever else asked the same meanwhile; null when the registry cannot answer.
using PlugInProxies = std::shared_ptr<const std::vector<PlugInProxyRef>>;

/// One application as the registry describes it.
struct ApplicationRecord {
    URL bundleURL;
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> localizedName;
    bool isApplication = true;  // a containing bundle that is none breaks an invariant of the registry
    bool isPlaceholder = false; // announced, but not completely installed yet
};

/// Hears of installs and removals, on a thread of the registry's choosing, one call at a time, each plug-in once.
class RegistryObserver {
public:
    virtual ~RegistryObserver() = default;
    virtual void pluginsDidInstall(const std::vector<PlugInProxyRef>& proxies) = 0;
    /// The plug-ins are no longer found when this is called.
    virtual void pluginsWillUninstall(const std::vector<PlugInProxyRef>& proxies) = 0;
};

/// All operations may be called from any thread.
class Registry {
public:
    /// Asked with a plug-in's identifier and its entitlements: whether to keep it.
    using Filter = std::function<bool(const std::string& identifier, const std::optional<Dictionary>& entitlements)>;

    virtual ~Registry() = default;

    /// Held weakly. Notices begin with changes after this call; plug-ins already known are not reported.
    virtual void addObserver(std::weak_ptr<RegistryObserver> observer) = 0;

    /// Ordered by UUID.
    virtual PlugInProxies installedPlugIns() = 0;

    /// A subset of the installed plug-ins that holds every one that matches `query` in the match-pattern language and
    /// passes `filter`, which is called before this returns; all pass an empty one.
    virtual PlugInProxies plugInsMatching(const Dictionary& query, const Filter& filter) = 0;

    virtual PlugInProxyRef plugInForUUID(const UUID& uuid) = 0;
    /// File URLs only. Locations are compared as they are: whoever asks for somebody else resolves symbolic links
    /// first, with that one's rights.
    virtual PlugInProxyRef plugInForURL(const URL& url) = 0;

    virtual std::shared_ptr<const ApplicationRecord> applicationForURL(const URL& url) = 0;
    /// In the order of their paths.
    virtual std::vector<PlugInProxyRef> plugInsOfApplication(const ApplicationRecord& application) = 0;

    /// Whether `peer` may have the plug-in at the location registered: to read its manifest must be its own right, for
    /// the answers to hosts show it. A location that can only be reached through symbolic links is refused.
    virtual bool mayRegister(const URL& url, const AuditToken& peer) = 0;
    // These two return after the notices of what they changed, and must not be called inside a notice.
    /// False when there is no usable plug-in bundle at the location itself; symbolic links are not followed.
    virtual bool registerPlugIn(const URL& url) = 0;
    /// False when nothing is registered there.
    virtual bool unregisterPlugIn(const URL& url) = 0;

    virtual void clearSchemaCaches() = 0;

    /// Changes exactly when the registry's data changes. Cheap: asked for on every manifest look-up.
    virtual std::optional<UUID> knowledgeUUID() = 0;
    virtual std::uint64_t knowledgeSequenceNumber() = 0;

    /// For each key found in the bundle's string table in the user's language, the string.
    virtual std::map<std::string, std::string>
    localizedStrings(const PlugInProxy& proxy, const std::set<std::string>& keys, const std::string& table) = 0;

    virtual std::optional<Dictionary> sdkDictionary(const std::string& extensionPoint) = 0;
};

} // namespace platform
