#include "zbd/ZBDatabase.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

#include <algorithm>
#include <bit>
#include <locale>
#include <stdexcept>

namespace zbd {

namespace log = zembra::log;
using platform::Dictionary;
using platform::PlugInProxies;
using platform::PlugInProxyRef;
using platform::URL;
using platform::UUID;
using platform::Value;

namespace {

std::optional<std::string> pathOf(const std::optional<URL>& url) {
    return url ? std::optional(url->path()) : std::nullopt;
}

/// Whether `text`, which is not empty, begins with a letter or digit of any script.
bool beginsAlphanumeric(std::string_view text) {
    static const std::locale unicode = [] {
        try {
            return std::locale("C.UTF-8");
        } catch (const std::runtime_error&) {
            return std::locale::classic(); // then ASCII has to do
        }
    }();
    // Strings are well-formed UTF-8: the first byte has as many ones in front as the character has bytes.
    const auto first = static_cast<unsigned char>(text.front());
    const int length = std::countl_one(first);
    auto character = static_cast<wchar_t>(first & (0x7F >> length));
    for (int at = 1; at < length; ++at) {
        character = static_cast<wchar_t>((character << 6) | (text[static_cast<std::size_t>(at)] & 0x3F));
    }
    return std::isalnum(character, unicode);
}

/// The election that a pattern asks for, or none when the pattern is more than "equals".
std::optional<std::string> electionOfPattern(const Value& pattern) {
    const auto text = pattern.string();
    if (!text || text->empty()) return std::nullopt;
    if (text->front() == '=') return std::string(text->substr(1));
    if (beginsAlphanumeric(*text)) return std::string(*text);
    return std::nullopt;
}

/// Answers whose records are at hand when the registry gives the same one again.
constexpr std::size_t maximumAnswers = 16;

bool isUsable(const PlugInProxyRef& proxy) {
    if (!proxy->bundleURL) {
        log::ops().info("skipping cx proxy %@ with nil bundleURL", proxy);
        return false;
    }
    const auto& container = proxy->containingBundle;
    if (container && !container->isApplication) {
        log::ops().error("CX reported containingBundle is not an application");
        return false;
    }
    if (container && container->isPlaceholder) {
        log::ops().info("skipping cx proxy %@ because its app is a placeholder", proxy);
        return false;
    }
    return true;
}

/// By UUID, and each UUID once.
void order(std::vector<ZBDPlugInRef>& plugIns) {
    std::ranges::sort(plugIns, {}, [](const ZBDPlugInRef& plugIn) { return *plugIn->uuid(); });
    const auto isSame = [](const ZBDPlugInRef& left, const ZBDPlugInRef& right) { return *left == *right; };
    plugIns.erase(std::unique(plugIns.begin(), plugIns.end(), isSame), plugIns.end());
}

} // namespace

ZBDatabase::ZBDatabase(platform::Platform& platform) : _platform(platform), _workspace(platform.registry) {}

void ZBDatabase::initWithDatabase(const std::optional<std::string>& annotationDatabasePath) {
    _annotations = ZBDAnnotationStore::initWithDatabase(_platform, annotationDatabasePath);
    _sync = _platform.queues.makeSerial("ZBDatabase");
    _workspace.addObserver(weak_from_this());
    _regionObserver =
        _platform.locale.observeChanges(_platform.runLoop.mainQueue(), [self = weak_from_this(), sync = _sync] {
            log::ops().notice("locale change detected; purging cache");
            sync->async([self] {
                if (const auto database = self.lock()) database->purgeCachesToLimit(0);
            });
        });
}

ZBDPlugInRef ZBDatabase::cachedPlugIn(const UUID& uuid) {
    const auto found = _cache.find(uuid);
    if (found == _cache.end()) return nullptr;
    if (found->second->isStillValid()) return found->second;
    forget(uuid);
    return nullptr;
}

ZBDPlugInRef ZBDatabase::plugInForProxy(const PlugInProxyRef& proxy) {
    return _sync->sync([&] { return recordForProxy(proxy); });
}

/// Where the registry was asked for the proxy on this queue too, a notice that outdates what it said comes after the
/// record is made, and takes it out of the cache.
ZBDPlugInRef ZBDatabase::recordForProxy(const PlugInProxyRef& proxy) {
    _sync->assertCurrent();
    const auto cached = proxy->uuid ? cachedPlugIn(*proxy->uuid) : nullptr;
    return cached ? cached : createPlugInForProxy(proxy);
}

ZBDPlugInRef ZBDatabase::createPlugInForProxy(const PlugInProxyRef& proxy) {
    _sync->assertCurrent();
    log::ops().notice("createPlugInForProxy");
    auto plugIn = ZBDPlugIn::initWithCXData(_platform, proxy, _recentForms);
    if (!plugIn) return nullptr;
    if (plugIn->hasEntitlement(zembra::entitlement::autoElectPlugIn)) autoElect(*plugIn);
    purgeCachesToLimit(_cacheLimit);
    forget(*plugIn->uuid());
    _cache.emplace(*plugIn->uuid(), plugIn);
    return plugIn;
}

void ZBDatabase::forget(const UUID& uuid) {
    _sync->assertCurrent();
    if (_cache.erase(uuid) != 0) _answers.clear();
}

void ZBDatabase::purgeCachesToLimit(std::uint32_t limit) {
    _sync->assertCurrent();
    if (_cache.size() <= limit) return;
    log::ops().info("purging cache for %d > %d", _cache.size(), limit);
    _cache.clear();
    _answers.clear();
    _workspace.clearSchemaCaches();
}

ZBDPlugInRef ZBDatabase::findPlugIn(const UUID& uuid) {
    return _sync->sync([&]() -> ZBDPlugInRef {
        if (auto cached = cachedPlugIn(uuid)) return cached;
        if (const auto proxy = _workspace.plugInForUUID(uuid)) return createPlugInForProxy(proxy);
        log::ops().info("Catalix cannot find plug-in with UUID:%{public}@", uuid);
        return nullptr;
    });
}

bool ZBDatabase::hasRecord(const UUID& uuid) const {
    return _sync->sync([&] { return _cache.contains(uuid); });
}

ZBDPlugInRef ZBDatabase::findPlugInAtPath(const std::optional<URL>& url) {
    const auto proxy = url ? _workspace.plugInForURL(*url) : nullptr;
    if (!proxy) {
        log::ops().info("Catalix cannot find plug-in at path:%@", pathOf(url));
        return nullptr;
    }
    return proxy->uuid ? findPlugIn(*proxy->uuid) : plugInForProxy(proxy);
}

std::optional<std::vector<ZBDPlugInRef>> ZBDatabase::plugInsWithinApplication(const URL& url) {
    return _sync->sync([&]() -> std::optional<std::vector<ZBDPlugInRef>> {
        const auto application = _workspace.applicationForURL(url);
        if (!application) return std::nullopt;
        const auto proxies = _workspace.plugInsOfApplication(*application);
        if (proxies.empty()) return std::nullopt;
        std::vector<ZBDPlugInRef> plugIns;
        for (const PlugInProxyRef& proxy : proxies) {
            if (auto plugIn = recordForProxy(proxy)) plugIns.push_back(std::move(plugIn));
        }
        return plugIns;
    });
}

std::optional<ZBDatabase::ElectionValues> ZBDatabase::electionPrefilter(const Dictionary& query) {
    const Value rule = query[zembra::ruleKey::userElection];
    if (const auto patterns = rule.array()) {
        ElectionValues values;
        for (const Value& pattern : *patterns) {
            auto value = electionOfPattern(pattern);
            if (!value) return std::nullopt;
            values.push_back(std::move(*value));
        }
        return values;
    }
    if (auto value = electionOfPattern(rule)) return ElectionValues{std::move(*value)};
    return std::nullopt;
}

bool ZBDatabase::acceptByElection(const ElectionValues& elections, const std::string& identifier,
                                  const std::optional<Dictionary>& entitlements) const {
    const auto annotation = _annotations->annotationForIdentifier(identifier);
    const Value stored = annotation ? (*annotation)[zembra::annotationKey::election] : Value();
    std::int64_t election = 0;
    if (stored) {
        election = stored.integerValue().value_or(0);
    } else if (entitlements) {
        election = (*entitlements)[zembra::entitlement::autoElectPlugIn].booleanValue().value_or(false) ? 1 : 0;
    }
    const std::string text = std::to_string(election & 255);
    return std::find(elections.begin(), elections.end(), text) != elections.end();
}

PlugInProxies ZBDatabase::proxiesFor(const std::optional<Dictionary>& query) {
    if (!query || query->empty()) {
        auto proxies = _workspace.installedPlugIns();
        log::cx().debug("%d installedPlugins: %@", proxies ? proxies->size() : 0, proxies);
        return proxies;
    }
    const auto elections = electionPrefilter(*query);
    const auto hasElection = [&](const std::string& identifier, const std::optional<Dictionary>& entitlements) {
        // A replacing plug-in shares the annotation of the one it replaces.
        const auto replaced = entitlements ? entitlements->string(zembra::entitlement::replacePlugIn) : std::nullopt;
        const std::string key(replaced.value_or(identifier));
        const bool accepted = acceptByElection(*elections, key, entitlements);
        log::ops().debug("cx filter %@ -> %d", key, accepted ? 1 : 0);
        return accepted;
    };
    auto proxies = _workspace.plugInsMatching(*query, elections ? platform::Registry::Filter(hasElection) : nullptr);
    log::cx().debug("%d plugin(s) matching %@ = %@", proxies ? proxies->size() : 0, *query, proxies);
    return proxies;
}

ZBDPlugIns ZBDatabase::findPlugIns(const std::optional<Dictionary>& query) {
    return _sync->sync([&]() -> ZBDPlugIns {
        const auto proxies = proxiesFor(query);
        const std::size_t countBefore = _cache.size();
        if (!proxies) return nullptr;
        auto plugIns = recordsFor(proxies);
        log::ops().debug("CX reported %u plug-ins (cache %u/%u)", plugIns->size(), countBefore, _cache.size());
        return plugIns;
    });
}

ZBDPlugIns ZBDatabase::recordsFor(const PlugInProxies& proxies) {
    const auto known = std::ranges::find(_answers, proxies, &Answer::proxies);
    if (known != _answers.end()) {
        _answers.splice(_answers.begin(), _answers, known);
        return known->records;
    }
    std::vector<ZBDPlugInRef> plugIns;
    plugIns.reserve(proxies->size());
    bool isOrdered = true; // mostly so, and then thousands of records need not be looked at again
    const UUID* last = nullptr;
    for (const PlugInProxyRef& proxy : *proxies) {
        isOrdered = isOrdered && proxy->uuid && (last == nullptr || *last < *proxy->uuid);
        last = isOrdered ? &*proxy->uuid : nullptr;
        if (!isUsable(proxy)) continue;
        if (auto plugIn = recordForProxy(proxy)) plugIns.push_back(std::move(plugIn));
    }
    if (!isOrdered) order(plugIns);
    const auto records = std::make_shared<const std::vector<ZBDPlugInRef>>(std::move(plugIns));
    // What was left out is tried, and told of, each time; so is what has no UUID. Making a record may have emptied the
    // cache.
    const bool areAll = records->size() == proxies->size() && records->size() <= _cache.size();
    const bool willComeAgain = proxies.use_count() > 1; // the registry has it too
    if (!areAll || !isOrdered || !willComeAgain) return records;
    _answers.push_front({proxies, records});
    if (_answers.size() > maximumAnswers) _answers.pop_back();
    return records;
}

platform::Failure ZBDatabase::addPlugIn(const URL& url) {
    if (_workspace.registerPlugIn(url)) return std::nullopt;
    return zembra::errorWithCode(zembra::code::registrationFailed, "Catalix failed to register the plug-in");
}

platform::Failure ZBDatabase::removePlugIn(const URL& url) {
    if (_workspace.unregisterPlugIn(url)) return std::nullopt;
    return zembra::errorWithCode(zembra::code::registrationFailed, "Catalix failed to deregister the plug-in");
}

void ZBDatabase::pluginsDidInstall(const std::vector<PlugInProxyRef>& proxies) {
    for (const PlugInProxyRef& proxy : proxies) {
        log::ops().notice("plug-in INSTALLED:%@ %@(%@) %{public}@ %@", proxy->bundleIdentifier, proxy->plugInIdentifier,
                          proxy->bundleVersion, proxy->uuid, pathOf(proxy->bundleURL));
    }
}

void ZBDatabase::pluginsWillUninstall(const std::vector<PlugInProxyRef>& proxies) {
    _sync->sync([&] {
        for (const PlugInProxyRef& proxy : proxies) {
            log::ops().notice("plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", proxy->bundleIdentifier,
                              proxy->plugInIdentifier, proxy->bundleVersion, proxy->uuid, pathOf(proxy->bundleURL));
            if (proxy->uuid) forget(*proxy->uuid);
        }
    });
    // Outside the queue, so that the delegate may use the database.
    if (const auto receiver = delegate()) receiver->removedPlugIns(proxies);
}

} // namespace zbd
