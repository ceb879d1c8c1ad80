#include "tests/support/RegistryFake.h"

namespace support {

using platform::PlugInProxyRef;

namespace {
std::optional<std::string> text(const platform::Dictionary& dictionary, std::string_view key) {
    auto view = dictionary.string(key);
    return view ? std::optional<std::string>(*view) : std::nullopt;
}
} // namespace

platform::PlugInProxy proxyFor(const FakePlugIn& plugIn) {
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
    proxy.localizedName = text(plugIn.info, "VBBundleDisplayName");
    proxy.localizedShortName = text(plugIn.info, "VBBundleName");
    if (!proxy.localizedName) proxy.localizedName = proxy.localizedShortName;
    proxy.entitlements = plugIn.entitlements;
    proxy.registrationDate = plugIn.registrationDate;
    proxy.onSystemPartition = plugIn.onSystemPartition;
    if (plugIn.dataContainer) proxy.dataContainerURL = platform::URL::file(*plugIn.dataContainer);
    proxy.containingBundle = plugIn.containingBundle;
    return proxy;
}

PlugInProxyRef FakeRegistry::install(platform::PlugInProxy proxy) {
    auto shared = std::make_shared<const platform::PlugInProxy>(std::move(proxy));
    return locked([&] {
        std::erase_if(_plugIns, [&](const auto& known) { return known->uuid && known->uuid == shared->uuid; });
        const auto uuidOf = [](const auto& known) { return known->uuid; };
        _plugIns.insert(std::ranges::upper_bound(_plugIns, shared->uuid, {}, uuidOf), shared);
        if (shared->containingBundle) {
            _applications[shared->containingBundle->bundleURL.path()] = shared->containingBundle;
        }
        changed();
        return PlugInProxyRef(shared);
    });
}

void FakeRegistry::uninstall(const platform::UUID& uuid) {
    locked([&] {
        if (std::erase_if(_plugIns, [&](const auto& known) { return known->uuid == uuid; }) > 0) changed();
    });
}

std::shared_ptr<const platform::ApplicationRecord>
FakeRegistry::installApplication(platform::ApplicationRecord application) {
    auto shared = std::make_shared<const platform::ApplicationRecord>(std::move(application));
    locked([&] {
        _applications[shared->bundleURL.path()] = shared;
        changed();
    });
    return shared;
}

void FakeRegistry::setStringTable(const std::string& bundlePath, const std::string& table,
                                  std::map<std::string, std::string> strings) {
    locked([&] { _tables[{bundlePath, table}] = std::move(strings); });
}

void FakeRegistry::setSDKDictionary(const std::string& extensionPoint, platform::Dictionary dictionary) {
    locked([&] { _sdks.insert_or_assign(extensionPoint, std::move(dictionary)); });
}

void FakeRegistry::fireDidInstall(const std::vector<PlugInProxyRef>& proxies) {
    for (const auto& observer : observers()) observer->pluginsDidInstall(proxies);
}

void FakeRegistry::fireWillUninstall(const std::vector<PlugInProxyRef>& proxies) {
    for (const auto& observer : observers()) observer->pluginsWillUninstall(proxies);
}

int FakeRegistry::calls(const std::string& operation) const {
    return locked([&] {
        auto found = _calls.find(operation);
        return found == _calls.end() ? 0 : found->second;
    });
}

void FakeRegistry::addObserver(std::weak_ptr<platform::RegistryObserver> observer) {
    (void)called("addObserver");
    locked([&] { _observers.push_back(std::move(observer)); });
}

std::optional<std::vector<PlugInProxyRef>> FakeRegistry::installedPlugIns() {
    if (called("installedPlugIns")) return std::nullopt;
    return locked([&] { return _plugIns; });
}

std::optional<std::vector<PlugInProxyRef>> FakeRegistry::plugInsMatching(const platform::Dictionary&,
                                                                         const Filter& filter) {
    if (called("plugInsMatching")) return std::nullopt;
    auto plugIns = locked([&] { return _plugIns; });
    std::erase_if(plugIns, [&](const auto& proxy) {
        return !filter(proxy->plugInIdentifier.value_or(std::string()), proxy->entitlements);
    });
    return plugIns;
}

PlugInProxyRef FakeRegistry::plugInForUUID(const platform::UUID& uuid) {
    if (called("plugInForUUID")) return nullptr;
    return locked([&] {
        auto found = std::ranges::find_if(_plugIns, [&](const auto& proxy) { return proxy->uuid == uuid; });
        return found == _plugIns.end() ? nullptr : *found;
    });
}

PlugInProxyRef FakeRegistry::plugInForURL(const platform::URL& url) {
    if (called("plugInForURL") || !url.isFile()) return nullptr;
    return locked([&] {
        auto found = std::ranges::find_if(
            _plugIns, [&](const auto& proxy) { return proxy->bundleURL && proxy->bundleURL->path() == url.path(); });
        return found == _plugIns.end() ? nullptr : *found;
    });
}

std::shared_ptr<const platform::ApplicationRecord> FakeRegistry::applicationForURL(const platform::URL& url) {
    if (called("applicationForURL") || !url.isFile()) return nullptr;
    return locked([&] {
        auto found = _applications.find(url.path());
        return found == _applications.end() ? nullptr : found->second;
    });
}

std::vector<PlugInProxyRef> FakeRegistry::plugInsOfApplication(const platform::ApplicationRecord& application) {
    if (called("plugInsOfApplication")) return {};
    auto plugIns = locked([&] { return _plugIns; });
    std::erase_if(plugIns, [&](const auto& proxy) {
        return !proxy->containingBundle || !(proxy->containingBundle->bundleURL == application.bundleURL);
    });
    std::ranges::sort(plugIns, {}, [](const auto& proxy) { return proxy->bundleURL ? proxy->bundleURL->path() : ""; });
    return plugIns;
}

bool FakeRegistry::mayRegister(const platform::URL& url, const platform::AuditToken&) {
    if (called("mayRegister")) return false;
    return locked([&] { return _registrationAllowed && !_closed.contains(url.path()); });
}

bool FakeRegistry::registerPlugIn(const platform::URL& url) {
    if (called("registerPlugIn")) return false;
    auto [allowed, action] = locked([&] { return std::pair(_registrationAllowed, _onRegister); });
    if (allowed && action) action(url);
    return allowed;
}

bool FakeRegistry::unregisterPlugIn(const platform::URL& url) {
    if (called("unregisterPlugIn")) return false;
    auto [allowed, action] = locked([&] { return std::pair(_registrationAllowed, _onUnregister); });
    if (allowed && action) action(url);
    return allowed;
}

std::optional<platform::UUID> FakeRegistry::knowledgeUUID() {
    if (called("knowledgeUUID")) return std::nullopt;
    return locked([&] { return _knowledge; });
}

std::uint64_t FakeRegistry::knowledgeSequenceNumber() {
    (void)called("knowledgeSequenceNumber");
    return locked([&] { return _sequence; });
}

std::map<std::string, std::string> FakeRegistry::localizedStrings(const platform::PlugInProxy& proxy,
                                                                  const std::set<std::string>& keys,
                                                                  const std::string& table) {
    if (called("localizedStrings") || !proxy.bundleURL) return {};
    return locked([&] {
        std::map<std::string, std::string> answer;
        auto strings = _tables.find({proxy.bundleURL->path(), table});
        if (strings == _tables.end()) return answer;
        for (const auto& [key, string] : strings->second) {
            if (keys.contains(key)) answer.emplace(key, string);
        }
        return answer;
    });
}

std::optional<platform::Dictionary> FakeRegistry::sdkDictionary(const std::string& extensionPoint) {
    if (called("sdkDictionary")) return std::nullopt;
    return locked([&]() -> std::optional<platform::Dictionary> {
        auto found = _sdks.find(extensionPoint);
        return found == _sdks.end() ? std::nullopt : std::optional(found->second);
    });
}

bool FakeRegistry::called(const std::string& operation) {
    std::function<void()> action;
    bool nothing = false;
    {
        std::lock_guard lock(_mutex);
        ++_calls[operation];
        if (auto found = _before.find(operation); found != _before.end()) action = found->second;
    }
    if (action) action();
    locked([&] { nothing = _answersNothing; });
    return nothing;
}

void FakeRegistry::changed() {
    // A registry that was told to have no knowledge UUID stays without one.
    if (_knowledge) _knowledge = platform::UUID::random();
    ++_sequence;
}

std::vector<std::shared_ptr<platform::RegistryObserver>> FakeRegistry::observers() const {
    return locked([&] {
        std::vector<std::shared_ptr<platform::RegistryObserver>> alive;
        for (const auto& weak : _observers) {
            if (auto observer = weak.lock()) alive.push_back(std::move(observer));
        }
        return alive;
    });
}

} // namespace support
