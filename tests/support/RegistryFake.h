#pragma once

#include "platform/Registry.h"

#include <algorithm>
#include <mutex>
#include <utility>

namespace support {

/// What a test says about a plug-in that the fake shall have installed.
struct FakePlugIn {
    std::string path;
    platform::Dictionary info;
    std::optional<platform::UUID> uuid = platform::UUID::random();
    std::optional<platform::Dictionary> entitlements = std::nullopt;
    platform::Date registrationDate{1'000'000'000};
    std::shared_ptr<const platform::ApplicationRecord> containingBundle = nullptr;
    bool onSystemPartition = false;
};

/// A proxy with the facts that the registry derives from a manifest. Tests change the copy they get as they like.
inline platform::PlugInProxy proxyFor(const FakePlugIn& plugIn) {
    const auto text = [](const auto& in, const char* key) { return std::optional<std::string>(in.string(key)); };
    platform::PlugInProxy proxy;
    proxy.uuid = plugIn.uuid;
    proxy.bundleURL = platform::URL::file(plugIn.path);
    proxy.infoDictionary = plugIn.info;
    proxy.plugInDictionary = plugIn.info.dictionary("VKExtension");
    proxy.bundleIdentifier = text(plugIn.info, "VBBundleIdentifier");
    proxy.bundleVersion = text(plugIn.info, "VBBundleVersion");
    if (proxy.plugInDictionary) proxy.plugInIdentifier = text(*proxy.plugInDictionary, "VKExtensionIdentifier");
    if (!proxy.plugInIdentifier) proxy.plugInIdentifier = proxy.bundleIdentifier;
    proxy.originalIdentifier = proxy.plugInIdentifier;
    proxy.entitlements = plugIn.entitlements;
    proxy.registrationDate = plugIn.registrationDate;
    proxy.onSystemPartition = plugIn.onSystemPartition;
    proxy.dataContainerURL = platform::URL::file("/containers/any");
    proxy.containingBundle = plugIn.containingBundle;
    return proxy;
}

/// The registry in memory. It knows what a test told it, refuses to register and unregister unless told to allow it,
/// gives notices only when a test fires them, and counts the calls of each operation. Any thread.
class FakeRegistry final : public platform::Registry {
    using URL = platform::URL;
    using UUID = platform::UUID;
    using Dictionary = platform::Dictionary;
    using Application = platform::ApplicationRecord;
    using ApplicationRef = std::shared_ptr<const Application>;
    using Proxy = platform::PlugInProxy;
    using PlugInProxyRef = platform::PlugInProxyRef;
    using Proxies = std::vector<PlugInProxyRef>;
    using Observer = platform::RegistryObserver;
    using Strings = std::map<std::string, std::string>;
    using Action = std::function<void(const URL&)>;
    using Callback = std::function<void()>;

public:
    // What is installed.
    PlugInProxyRef install(const FakePlugIn& plugIn) { return install(proxyFor(plugIn)); }
    /// Replaces an installed plug-in of the same UUID. Changes the knowledge UUID, gives no notice.
    PlugInProxyRef install(Proxy proxy) {
        const auto shared = std::make_shared<const Proxy>(std::move(proxy));
        const std::lock_guard lock(_mutex);
        std::erase_if(_plugIns, [&](const auto& known) { return known->uuid && known->uuid == shared->uuid; });
        const auto uuidOf = [](const auto& known) { return known->uuid; };
        _plugIns.insert(std::ranges::upper_bound(_plugIns, shared->uuid, {}, uuidOf), shared);
        if (const auto& around = shared->containingBundle) _applications[around->bundleURL.path()] = around;
        changed();
        return shared;
    }
    void uninstall(const UUID& uuid) {
        const std::lock_guard lock(_mutex);
        if (std::erase_if(_plugIns, [&](const auto& known) { return known->uuid == uuid; }) > 0) changed();
    }
    ApplicationRef installApplication(Application application) {
        const auto shared = std::make_shared<const Application>(std::move(application));
        put(_applications, shared->bundleURL.path(), shared);
        return shared;
    }
    void setStringTable(const std::string& bundlePath, const std::string& table, Strings strings) {
        put(_tables, {bundlePath, table}, std::move(strings));
    }
    void setSDKDictionary(const std::string& point, Dictionary sdk) { put(_sdks, point, std::move(sdk)); }

    // What it does when asked.
    void allowRegistration(bool allow = true) { set(_registrationAllowed, allow); }
    /// No peer may have the plug-in at `path` registered. The others follow `allowRegistration`.
    void close(const std::string& path) { put(_closed, path, true); }
    /// What registration of an allowed path installs; without it registration only answers.
    void onRegister(Action action) { set(_onRegister, std::move(action)); }
    void onUnregister(Action action) { set(_onUnregister, std::move(action)); }
    /// Look-ups and queries answer none, as a registry that is out of order does.
    void answerNothing() { set(_answersNothing, true); }
    void setKnowledgeUUID(std::optional<UUID> uuid) { set(_knowledge, uuid); }
    /// Calls `action` at the beginning of each call of the operation, outside the fake's lock.
    void before(const std::string& operation, Callback action) { put(_before, operation, std::move(action)); }

    // Notices, given on the caller's thread.
    void fireDidInstall(const Proxies& proxies) { tell(&Observer::pluginsDidInstall, proxies); }
    void fireWillUninstall(const Proxies& proxies) { tell(&Observer::pluginsWillUninstall, proxies); }

    /// How often the operation of that name was called.
    int calls(const std::string& operation) { return get(_calls)[operation]; }
    void resetCalls() { set(_calls, {}); }

    void addObserver(std::weak_ptr<Observer> observer) override {
        const std::lock_guard lock(_mutex);
        _observers.push_back(std::move(observer));
    }
    platform::PlugInProxies installedPlugIns() override { return called("installedPlugIns") ? nullptr : listed(); }
    /// Leaves the query to the caller: everything that passes the filter, which is the largest allowed answer.
    platform::PlugInProxies plugInsMatching(const Dictionary&, const Filter& filter) override {
        if (called("plugInsMatching")) return nullptr;
        if (!filter) return listed();
        return std::make_shared<const Proxies>(
            those([&](const Proxy& one) { return filter(one.plugInIdentifier.value_or(""), one.entitlements); }));
    }
    PlugInProxyRef plugInForUUID(const UUID& uuid) override {
        return called("plugInForUUID") ? nullptr : first([&](const Proxy& one) { return one.uuid == uuid; });
    }
    PlugInProxyRef plugInForURL(const URL& url) override {
        if (called("plugInForURL") || !url.isFile()) return nullptr;
        return first([&](const Proxy& one) { return one.bundleURL && one.bundleURL->path() == url.path(); });
    }
    ApplicationRef applicationForURL(const URL& url) override {
        return called("applicationForURL") || !url.isFile() ? nullptr : get(_applications)[url.path()];
    }
    Proxies plugInsOfApplication(const Application& application) override {
        if (called("plugInsOfApplication")) return {};
        auto plugIns = those([&](const Proxy& one) {
            return one.containingBundle && one.containingBundle->bundleURL == application.bundleURL;
        });
        const auto pathOf = [](const auto& proxy) { return proxy->bundleURL ? proxy->bundleURL->path() : ""; };
        std::ranges::sort(plugIns, {}, pathOf);
        return plugIns;
    }
    bool mayRegister(const URL& url, const platform::AuditToken&) override {
        return !called("mayRegister") && get(_registrationAllowed) && !get(_closed).contains(url.path());
    }
    bool registerPlugIn(const URL& url) override { return change("registerPlugIn", _onRegister, url); }
    bool unregisterPlugIn(const URL& url) override { return change("unregisterPlugIn", _onUnregister, url); }
    void clearSchemaCaches() override { (void)called("clearSchemaCaches"); }
    std::optional<UUID> knowledgeUUID() override { return called("knowledgeUUID") ? std::nullopt : get(_knowledge); }
    std::uint64_t knowledgeSequenceNumber() override { return get(_sequence); }
    Strings localizedStrings(const Proxy& proxy, const std::set<std::string>& keys, const std::string& table) override {
        if (called("localizedStrings") || !proxy.bundleURL) return {};
        Strings strings = get(_tables)[{proxy.bundleURL->path(), table}];
        std::erase_if(strings, [&](const auto& entry) { return !keys.contains(entry.first); });
        return strings;
    }
    std::optional<Dictionary> sdkDictionary(const std::string& extensionPoint) override {
        return called("sdkDictionary") ? std::nullopt : get(_sdks)[extensionPoint];
    }

private:
    platform::PlugInProxies listed() {
        const std::lock_guard lock(_mutex);
        if (!_listed) _listed = std::make_shared<const Proxies>(_plugIns);
        return _listed;
    }
    template <class T> T get(const T& member) const {
        const std::lock_guard lock(_mutex);
        return member;
    }
    template <class T> void set(T& member, std::type_identity_t<T> value) {
        const std::lock_guard lock(_mutex);
        member = std::move(value);
    }
    template <class M> void put(M& map, const typename M::key_type& key, typename M::mapped_type value) {
        const std::lock_guard lock(_mutex);
        map[key] = std::move(value);
    }
    template <class F> Proxies those(F&& fit) const {
        auto plugIns = get(_plugIns);
        std::erase_if(plugIns, [&](const auto& one) { return !fit(*one); });
        return plugIns;
    }
    template <class F> PlugInProxyRef first(F&& fits) const {
        const auto found = those(fits);
        return found.empty() ? nullptr : found.front();
    }
    void tell(void (Observer::*notice)(const Proxies&), const Proxies& proxies) {
        for (const auto& weak : get(_observers))
            if (const auto observer = weak.lock()) (*observer.*notice)(proxies);
    }
    /// Counts the call; true when the operation shall answer nothing.
    bool called(const std::string& operation) {
        std::unique_lock lock(_mutex);
        ++_calls[operation];
        const auto action = _before[operation];
        lock.unlock();
        if (action) action();
        return get(_answersNothing);
    }
    bool change(const std::string& operation, const Action& onChange, const URL& url) {
        if (called(operation) || !get(_registrationAllowed)) return false;
        if (const auto action = get(onChange)) action(url);
        return true;
    }
    /// A registry that was told to have no knowledge UUID stays without one. With the lock held.
    void changed() {
        if (_knowledge) _knowledge = UUID::random();
        ++_sequence;
        _listed.reset();
    }

    mutable std::mutex _mutex;
    Proxies _plugIns;                                    // ordered by UUID, those without one first
    platform::PlugInProxies _listed;                     // what the last who asked for all was given
    std::map<std::string, ApplicationRef> _applications; // by path
    std::map<std::pair<std::string, std::string>, Strings> _tables;
    std::map<std::string, std::optional<Dictionary>> _sdks;
    std::vector<std::weak_ptr<Observer>> _observers;
    std::map<std::string, Callback> _before;
    std::map<std::string, int> _calls;
    std::map<std::string, bool> _closed;
    Action _onRegister;
    Action _onUnregister;
    std::optional<UUID> _knowledge = UUID::random();
    std::uint64_t _sequence = 1;
    bool _registrationAllowed = false;
    bool _answersNothing = false;
};

} // namespace support
