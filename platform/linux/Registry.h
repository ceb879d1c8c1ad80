#pragma once

#include "platform/Containers.h"
#include "platform/Locale.h"
#include "platform/Registry.h"
#include "platform/linux/DescriptorStore.h"
#include "platform/linux/Root.h"

#include <chrono>
#include <cstddef>
#include <memory>

namespace platform::linux_ {

/// Bounds that a test or an unusual machine sets otherwise.
struct RegistryLimits {
    /// Directories watched at once; each costs about a kilobyte of kernel memory. Bundles beyond are verified whenever
    /// the registry is asked, instead of when they change.
    std::size_t watches = 1'000'000;
    /// Removed plug-ins whose UUIDs are remembered for the day they come back.
    std::size_t removedPlugIns = 4096;
};

/// The application registry kept from the bundles on disk: `docs/bundles-and-state.md` tells where bundles are looked
/// for, what is kept in the database, and what each change on disk leads to.
///
/// One thread reads the disk, changes what is known and calls the observers; every other operation reads an immutable
/// snapshot and never waits for that thread. `registerPlugIn`, `unregisterPlugIn` and `settle` do wait for it, their
/// notices included, and are therefore a bug inside a notice.
class Registry final : public platform::Registry {
public:
    /// Reads the database; the disk is looked at as far as answers need it. The services must outlive the registry.
    /// `descriptors`, if any, keeps the watch between one registry and the next, which then need not look at
    /// everything.
    Registry(const Root& root, platform::Locale& locale, platform::Containers& containers, RegistryLimits limits = {},
             DescriptorStore* descriptors = nullptr);
    /// Returns when the thread has ended; a notice under way is finished, later changes are found at the next start.
    ~Registry() override;
    Registry(const Registry&) = delete;
    Registry& operator=(const Registry&) = delete;

    void addObserver(std::weak_ptr<RegistryObserver> observer) override;
    PlugInProxies installedPlugIns() override;
    PlugInProxies plugInsMatching(const Dictionary& query, const Filter& filter) override;
    PlugInProxyRef plugInForUUID(const UUID& uuid) override;
    PlugInProxyRef plugInForURL(const URL& url) override;
    std::shared_ptr<const ApplicationRecord> applicationForURL(const URL& url) override;
    std::vector<PlugInProxyRef> plugInsOfApplication(const ApplicationRecord& application) override;
    bool mayRegister(const URL& url, const AuditToken& peer) override;
    bool registerPlugIn(const URL& url) override;
    bool unregisterPlugIn(const URL& url) override;
    void clearSchemaCaches() override;
    std::optional<UUID> knowledgeUUID() override;
    std::uint64_t knowledgeSequenceNumber() override;
    std::map<std::string, std::string> localizedStrings(const PlugInProxy& proxy, const std::set<std::string>& keys,
                                                        const std::string& table) override;
    std::optional<Dictionary> sdkDictionary(const std::string& extensionPoint) override;

    /// Returns when everything that happened on disk before the call is known and its notices were given.
    void settle();
    /// For the end of the process: nothing is taken in any more. Returns when the thread has ended, or after the time.
    void stop(std::chrono::milliseconds patience);

private:
    class Implementation;
    std::unique_ptr<Implementation> _implementation;
};

} // namespace platform::linux_
