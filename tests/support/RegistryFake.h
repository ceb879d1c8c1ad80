#pragma once

#include "platform/Registry.h"

#include <algorithm>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

namespace support {

/// What a test says about a plug-in that the fake shall have installed.
struct FakePlugIn {
    std::string path;
    platform::Dictionary info;
    std::optional<platform::UUID> uuid = platform::UUID::random();
    std::optional<platform::Dictionary> entitlements = std::nullopt;
    std::optional<platform::Date> registrationDate = platform::Date{1'000'000'000};
    std::shared_ptr<const platform::ApplicationRecord> containingBundle = nullptr;
    bool onSystemPartition = false;
    std::optional<std::string> dataContainer = "/containers/any";
};

/// A proxy with the facts that the registry derives from a manifest. Tests change the copy they get as they like.
platform::PlugInProxy proxyFor(const FakePlugIn& plugIn);

/// The registry in memory. It knows what a test told it, refuses to register and unregister unless told to allow it,
/// gives notices only when a test fires them, and counts the calls of each operation. Any thread.
class FakeRegistry final : public platform::Registry {
public:
    // What is installed.
    platform::PlugInProxyRef install(const FakePlugIn& plugIn) { return install(proxyFor(plugIn)); }
    /// Replaces an installed plug-in of the same UUID. Changes the knowledge UUID, gives no notice.
    platform::PlugInProxyRef install(platform::PlugInProxy proxy);
    void uninstall(const platform::UUID& uuid);
    std::shared_ptr<const platform::ApplicationRecord> installApplication(platform::ApplicationRecord application);
    void setStringTable(const std::string& bundlePath, const std::string& table,
                        std::map<std::string, std::string> strings);
    void setSDKDictionary(const std::string& extensionPoint, platform::Dictionary dictionary);

    // What it does when asked.
    /// No peer may have the plug-in at `path` registered. The others follow `allowRegistration`.
    void close(const std::string& path) {
        locked([&] { _closed.insert(path); });
    }
    void allowRegistration(bool allow = true) {
        locked([&] { _registrationAllowed = allow; });
    }
    /// What registration of an allowed path installs; without it registration only answers.
    void onRegister(std::function<void(const platform::URL&)> action) {
        locked([&] { _onRegister = std::move(action); });
    }
    void onUnregister(std::function<void(const platform::URL&)> action) {
        locked([&] { _onUnregister = std::move(action); });
    }
    /// Look-ups and queries answer none, as a registry that is out of order does.
    void answerNothing(bool nothing = true) {
        locked([&] { _answersNothing = nothing; });
    }
    void setKnowledgeUUID(std::optional<platform::UUID> uuid) {
        locked([&] { _knowledge = uuid; });
    }
    /// Calls `action` at the beginning of each call of the operation, outside the fake's lock.
    void before(const std::string& operation, std::function<void()> action) {
        locked([&] { _before[operation] = std::move(action); });
    }

    // Notices, given on the caller's thread.
    void fireDidInstall(const std::vector<platform::PlugInProxyRef>& proxies);
    void fireWillUninstall(const std::vector<platform::PlugInProxyRef>& proxies);

    /// How often the operation of that name was called.
    int calls(const std::string& operation) const;
    void resetCalls() {
        locked([&] { _calls.clear(); });
    }

    void addObserver(std::weak_ptr<platform::RegistryObserver> observer) override;
    std::optional<std::vector<platform::PlugInProxyRef>> installedPlugIns() override;
    /// Leaves the query to the caller: everything that passes the filter, which is the largest allowed answer.
    std::optional<std::vector<platform::PlugInProxyRef>> plugInsMatching(const platform::Dictionary& query,
                                                                         const Filter& filter) override;
    platform::PlugInProxyRef plugInForUUID(const platform::UUID& uuid) override;
    platform::PlugInProxyRef plugInForURL(const platform::URL& url) override;
    std::shared_ptr<const platform::ApplicationRecord> applicationForURL(const platform::URL& url) override;
    std::vector<platform::PlugInProxyRef> plugInsOfApplication(const platform::ApplicationRecord& application) override;
    bool mayRegister(const platform::URL& url, const platform::AuditToken& peer) override;
    bool registerPlugIn(const platform::URL& url) override;
    bool unregisterPlugIn(const platform::URL& url) override;
    void clearSchemaCaches() override { (void)called("clearSchemaCaches"); }
    std::optional<platform::UUID> knowledgeUUID() override;
    std::uint64_t knowledgeSequenceNumber() override;
    std::map<std::string, std::string> localizedStrings(const platform::PlugInProxy& proxy,
                                                        const std::set<std::string>& keys,
                                                        const std::string& table) override;
    std::optional<platform::Dictionary> sdkDictionary(const std::string& extensionPoint) override;

private:
    template <class F> std::invoke_result_t<F> locked(F&& action) const {
        std::lock_guard lock(_mutex);
        return action();
    }
    /// Counts the call; true when the operation shall answer nothing.
    bool called(const std::string& operation);
    void changed();
    std::vector<std::shared_ptr<platform::RegistryObserver>> observers() const;

    mutable std::mutex _mutex;
    std::vector<platform::PlugInProxyRef> _plugIns; // ordered by UUID, those without one first
    std::map<std::string, std::shared_ptr<const platform::ApplicationRecord>> _applications; // by path
    std::map<std::pair<std::string, std::string>, std::map<std::string, std::string>> _tables;
    std::map<std::string, platform::Dictionary> _sdks;
    std::vector<std::weak_ptr<platform::RegistryObserver>> _observers;
    std::map<std::string, std::function<void()>> _before;
    std::map<std::string, int> _calls;
    std::set<std::string> _closed;
    std::function<void(const platform::URL&)> _onRegister;
    std::function<void(const platform::URL&)> _onUnregister;
    std::optional<platform::UUID> _knowledge = platform::UUID::random();
    std::uint64_t _sequence = 1;
    bool _registrationAllowed = false;
    bool _answersNothing = false;
};

} // namespace support
