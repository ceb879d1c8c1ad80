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
    std::optional<platform::Date> registrationDate = platform::Date{1'000'000'000};
    std::shared_ptr<const platform::ApplicationRecord> containingBundle = nullptr;
    bool onSystemPartition = false;
    std::optional<std::string> dataContainer = "/containers/any";
};

/// A proxy with the facts that the registry derives from a manifest. Tests change the copy they get as they like.
inline platform::PlugInProxy proxyFor(const FakePlugIn& plugIn) {
    const auto text = [](const platform::Dictionary& dictionary, std::string_view key) {
        const auto view = dictionary.string(key);
        return view ? std::optional<std::string>(*view) : std::nullopt;
    };
    platform::PlugInProxy proxy;
    proxy.uuid = plugIn.uuid;
    proxy.bundleURL = platform::URL::file(plugIn.path);
    proxy.infoDictionary = plugIn.info;
    proxy.plugInDictionary = plugIn.info.dictionary("VKExtension");
    if (!proxy.plugInDictionary) proxy.plugInDictionary = plugIn.info.dictionary("Zembra");
    proxy.bundleIdentifier = text(plugIn.info, "VBBundleIdentifier");
    proxy.bundleVersion = text(plugIn.info, "VBBundleVersion");
    if (proxy.plugInDictionary) proxy.plugInIdentifier = text(*proxy.plugInDictionary, "VKExtensionIdentifier");
    if (!proxy.plugInIdentifier) proxy.plugInIdentifier = proxy.bundleIdentifier;
    proxy.originalIdentifier = proxy.plugInIdentifier;
    proxy.localizedShortName = text(plugIn.info, "VBBundleName");
    proxy.localizedName = text(plugIn.info, "VBBundleDisplayName");
    if (!proxy.localizedName) proxy.localizedName = proxy.localizedShortName;
    proxy.entitlements = plugIn.entitlements;
    proxy.registrationDate = plugIn.registrationDate;
    proxy.onSystemPartition = plugIn.onSystemPartition;
    if (plugIn.dataContainer) proxy.dataContainerURL = platform::URL::file(*plugIn.dataContainer);
    proxy.containingBundle = plugIn.containingBundle;
    return proxy;
}

/// The registry in memory. It knows what a test told it, refuses to register and unregister unless told to allow it,
/// gives notices only when a test fires them, and counts the calls of each operation. Any thread.
class FakeRegistry final : public platform::Registry {
    using URL = platform::URL;
    using UUID = platform::UUID;
    using Dictionary = platform::Dictionary;
    using PlugInProxyRef = platform::PlugInProxyRef;
    using Proxies = std::vector<PlugInProxyRef>;
    using Callback = std::function<void()>;
    using ApplicationRef = std::shared_ptr<const platform::ApplicationRecord>;
    using Strings = std::map<std::string, std::string>;
    using Action = std::function<void(const URL&)>;

public:
    // What is installed.
    PlugInProxyRef install(const FakePlugIn& plugIn) { return install(proxyFor(plugIn)); }
    /// Replaces an installed plug-in of the same UUID. Changes the knowledge UUID, gives no notice.
    PlugInProxyRef install(platform::PlugInProxy proxy) {
        const auto shared = std::make_shared<const platform::PlugInProxy>(std::move(proxy));
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
    ApplicationRef installApplication(platform::ApplicationRecord application) {
        const auto shared = std::make_shared<const platform::ApplicationRecord>(std::move(application));
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
    void close(const std::string& path) {
        const std::lock_guard lock(_mutex);
        _closed.insert(path);
    }
    /// What registration of an allowed path installs; without it registration only answers.
    void onRegister(Action action) { set(_onRegister, std::move(action)); }
    void onUnregister(Action action) { set(_onUnregister, std::move(action)); }
    /// Look-ups and queries answer none, as a registry that is out of order does.
    void answerNothing(bool nothing = true) { set(_answersNothing, nothing); }
    void setKnowledgeUUID(std::optional<UUID> uuid) { set(_knowledge, uuid); }
    /// Calls `action` at the beginning of each call of the operation, outside the fake's lock.
    void before(const std::string& operation, Callback action) { put(_before, operation, std::move(action)); }

    // Notices, given on the caller's thread.
    void fireDidInstall(const Proxies& proxies) {
        for (const auto& weak : get(_observers))
            if (const auto observer = weak.lock()) observer->pluginsDidInstall(proxies);
    }
    void fireWillUninstall(const Proxies& proxies) {
        for (const auto& weak : get(_observers))
            if (const auto observer = weak.lock()) observer->pluginsWillUninstall(proxies);
    }

    /// How often the operation of that name was called.
    int calls(const std::string& operation) { return get(_calls)[operation]; }
    void resetCalls() { set(_calls, {}); }

    void addObserver(std::weak_ptr<platform::RegistryObserver> observer) override {
        const std::lock_guard lock(_mutex);
        _observers.push_back(std::move(observer));
    }
    std::optional<Proxies> installedPlugIns() override {
        return called("installedPlugIns") ? std::nullopt : std::optional(get(_plugIns));
    }
    /// Leaves the query to the caller: everything that passes the filter, which is the largest allowed answer.
    std::optional<Proxies> plugInsMatching(const Dictionary&, const Filter& filter) override {
        if (called("plugInsMatching")) return std::nullopt;
        auto plugIns = get(_plugIns);
        std::erase_if(plugIns, [&](const auto& proxy) {
            return !filter(proxy->plugInIdentifier.value_or(std::string()), proxy->entitlements);
        });
        return plugIns;
    }
    PlugInProxyRef plugInForUUID(const UUID& uuid) override {
        if (called("plugInForUUID")) return nullptr;
        return find([&](const auto& proxy) { return proxy->uuid == uuid; });
    }
    PlugInProxyRef plugInForURL(const URL& url) override {
        if (called("plugInForURL") || !url.isFile()) return nullptr;
        return find([&](const auto& proxy) { return proxy->bundleURL && proxy->bundleURL->path() == url.path(); });
    }
    ApplicationRef applicationForURL(const URL& url) override {
        if (called("applicationForURL") || !url.isFile()) return nullptr;
        return get(_applications)[url.path()];
    }
    Proxies plugInsOfApplication(const platform::ApplicationRecord& application) override {
        if (called("plugInsOfApplication")) return {};
        auto plugIns = get(_plugIns);
        std::erase_if(plugIns, [&](const auto& proxy) {
            return !proxy->containingBundle || proxy->containingBundle->bundleURL != application.bundleURL;
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
    Strings localizedStrings(const platform::PlugInProxy& proxy, const std::set<std::string>& keys,
                             const std::string& table) override {
        if (called("localizedStrings") || !proxy.bundleURL) return {};
        Strings strings = get(_tables)[{proxy.bundleURL->path(), table}];
        std::erase_if(strings, [&](const auto& entry) { return !keys.contains(entry.first); });
        return strings;
    }
    std::optional<Dictionary> sdkDictionary(const std::string& extensionPoint) override {
        if (called("sdkDictionary")) return std::nullopt;
        const auto sdks = get(_sdks);
        const auto found = sdks.find(extensionPoint);
        return found == sdks.end() ? std::nullopt : std::optional(found->second);
    }

private:
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
        map.insert_or_assign(key, std::move(value));
    }
    template <class F> PlugInProxyRef find(F&& fits) const {
        const std::lock_guard lock(_mutex);
        const auto found = std::ranges::find_if(_plugIns, fits);
        return found == _plugIns.end() ? nullptr : *found;
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
    }

    mutable std::mutex _mutex;
    Proxies _plugIns;                                    // ordered by UUID, those without one first
    std::map<std::string, ApplicationRef> _applications; // by path
    std::map<std::pair<std::string, std::string>, Strings> _tables;
    std::map<std::string, Dictionary> _sdks;
    std::vector<std::weak_ptr<platform::RegistryObserver>> _observers;
    std::map<std::string, Callback> _before;
    std::map<std::string, int> _calls;
    std::set<std::string> _closed;
    Action _onRegister;
    Action _onUnregister;
    std::optional<UUID> _knowledge = UUID::random();
    std::uint64_t _sequence = 1;
    bool _registrationAllowed = false;
    bool _answersNothing = false;
};

} // namespace support
