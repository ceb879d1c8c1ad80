#pragma once

#include "Zembra/AtomicField.h"
#include "platform/Platform.h"
#include "zbd/ZBDAnnotationStore.h"
#include "zbd/ZBDPlugIn.h"

#include <cstdint>
#include <list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace zbd {

using ZBDPlugInRef = std::shared_ptr<ZBDPlugIn>;
/// Shared with others who asked the same; null when the registry does not answer.
using ZBDPlugIns = std::shared_ptr<const std::vector<ZBDPlugInRef>>;
using ZBDPlugInSet = std::unordered_set<ZBDPlugInRef, zembra::ZBPlugInHash, zembra::ZBPlugInEqual>;

/// Told of uninstalled plug-ins after the database has let go of them. Called on the registry's thread.
class ZBDatabaseDelegate {
public:
    virtual ~ZBDatabaseDelegate() = default;
    virtual void removedPlugIns(const std::vector<platform::PlugInProxyRef>& proxies) = 0;
};

/// The daemon's view of the installed plug-ins: turns the registry's proxies into cached records, answers lookups, and
/// owns the user's annotations. The record cache and the annotation store belong to the database queue; lookups enter
/// it synchronously, so none may be made from work that runs on it.
class ZBDatabase : public platform::RegistryObserver, public std::enable_shared_from_this<ZBDatabase> {
public:
    static constexpr std::uint32_t defaultCacheLimit = 1'000'000;

    /// Reads the annotations and begins to follow the registry and the locale. The object must be held by a shared
    /// pointer.
    void initWithDatabase(const std::optional<std::string>& annotationDatabasePath);

    ZBDPlugInRef plugInForProxy(const platform::PlugInProxyRef& proxy);
    /// On the database queue only.
    ZBDPlugInRef createPlugInForProxy(const platform::PlugInProxyRef& proxy);
    /// All or nothing: a cache of more than `limit` records is emptied. On the database queue only.
    void purgeCachesToLimit(std::uint32_t limit);

    /// The records of the plug-ins that may match `query`; of all installed ones when it is absent or empty. Each once,
    /// in the order of the registry's UUIDs, so that the same question gets the same answer. The caller judges them by
    /// its rules.
    ZBDPlugIns findPlugIns(const std::optional<platform::Dictionary>& query);
    ZBDPlugInRef findPlugIn(const platform::UUID& uuid);
    /// Whether the plug-in's record is cached.
    bool hasRecord(const platform::UUID& uuid) const;
    /// None also for what is no URL.
    ZBDPlugInRef findPlugInAtPath(const std::optional<platform::URL>& url);
    /// None when the application is unknown or has no plug-ins.
    std::optional<std::vector<ZBDPlugInRef>> plugInsWithinApplication(const platform::URL& url);

    platform::Failure addPlugIn(const platform::URL& url);
    platform::Failure removePlugIn(const platform::URL& url);

    // ZBDatabaseAnnotations.cpp
    std::optional<platform::Dictionary> annotationForPlugIn(const ZBDPlugIn& plugIn);
    /// Another one after each change of annotations. Any thread.
    std::uint64_t annotationsVersion() const { return _annotations->version(); }
    void setAnnotation(const std::optional<platform::Dictionary>& annotation, const ZBDPlugIn& plugIn);
    void setAnnotations(std::span<const AnnotationChange> changes);
    /// Tells every host that annotations or holds changed. Any thread.
    void notifyAnnotationChange();
    /// Elects a plug-in that asks for it, unless the user decided otherwise. On the database queue only.
    void autoElect(const ZBDPlugIn& plugIn);

    // platform::RegistryObserver
    void pluginsDidInstall(const std::vector<platform::PlugInProxyRef>& proxies) override;
    void pluginsWillUninstall(const std::vector<platform::PlugInProxyRef>& proxies) override;

    std::uint32_t cacheLimit() const { return _cacheLimit; }
    /// Before the first request.
    void setCacheLimit(std::uint32_t limit) { _cacheLimit = limit; }
    std::shared_ptr<ZBDatabaseDelegate> delegate() const { return _delegate.get().lock(); }
    /// Held weakly. Any thread; notices that come before are passed on to nobody.
    void setDelegate(std::weak_ptr<ZBDatabaseDelegate> delegate) { _delegate.set(std::move(delegate)); }

    platform::Platform& platform() const { return _platform; }

protected:
    explicit ZBDatabase(platform::Platform& platform);

private:
    using ElectionValues = std::vector<std::string>;
    static std::optional<ElectionValues> electionPrefilter(const platform::Dictionary& query);
    bool acceptByElection(const ElectionValues& elections, const std::string& identifier,
                          const std::optional<platform::Dictionary>& entitlements) const;
    ZBDPlugInRef cachedPlugIn(const platform::UUID& uuid);
    ZBDPlugInRef recordForProxy(const platform::PlugInProxyRef& proxy);
    platform::PlugInProxies proxiesFor(const std::optional<platform::Dictionary>& query);
    ZBDPlugIns recordsFor(const platform::PlugInProxies& proxies);
    void forget(const platform::UUID& uuid);

    platform::Platform& _platform;
    std::uint32_t _cacheLimit = defaultCacheLimit;
    zembra::AtomicField<std::weak_ptr<ZBDatabaseDelegate>> _delegate;
    platform::Registry& _workspace;
    std::unique_ptr<ZBDAnnotationStore> _annotations; // changed on _sync, and only while a request waits
                                                      // for it: so the service queue may read it too
    std::shared_ptr<platform::WorkQueue> _sync;

    // On _sync only.
    std::unordered_map<platform::UUID, ZBDPlugInRef> _cache;
    struct Answer {
        platform::PlugInProxies proxies;
        ZBDPlugIns records; // all of them cached
    };
    std::list<Answer> _answers; // the last used one first
    const std::shared_ptr<RecentForms> _recentForms = std::make_shared<RecentForms>();
    std::unique_ptr<platform::LocaleObservation> _regionObserver;
};

} // namespace zbd
