#include "zbd/ZBDPlugIn.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

#include <cmath>
#include <set>

namespace zbd {

namespace log = zembra::log;
namespace manifest = zembra::manifest;
using platform::Dictionary;
using platform::MutableDictionary;
using platform::PlugInProxyRef;
using platform::UUID;
using platform::Value;
using zembra::valueOrAbsent;

namespace {

/// `text` as a value that shares the storage of one of `known` where that is the same text: thousands of records are
/// kept.
Value sharing(const std::optional<std::string>& text, std::initializer_list<Value> known) {
    for (const Value& value : known) {
        if (text && value.string() == *text) return value;
    }
    return valueOrAbsent(text);
}

} // namespace

std::shared_ptr<ZBDPlugIn> ZBDPlugIn::initWithCXData(platform::Platform& platform, const PlugInProxyRef& proxy,
                                                     std::shared_ptr<RecentForms> recentForms) {
    std::shared_ptr<ZBDPlugIn> self(new ZBDPlugIn(platform, std::move(recentForms)));
    return self->setupWithProxy(proxy) ? self : nullptr;
}

bool ZBDPlugIn::setupWithProxy(const PlugInProxyRef& proxy) {
    if (!proxy->bundleURL) return false;
    const Dictionary info = proxy->infoDictionary.value_or(Dictionary());
    const Dictionary declared = proxy->plugInDictionary.value_or(Dictionary());
    if (!initializeWithName(
            sharing(proxy->plugInIdentifier, {info[manifest::bundleIdentifier], declared[manifest::identifier]}),
            proxy->bundleURL, Value(), valueOrAbsent(proxy->plugInDictionary), proxy->uuid)) {
        return false;
    }
    const auto& container = proxy->containingBundle;

    setLastModified(static_cast<std::int64_t>(std::trunc(proxy->registrationDate.value_or(platform::Date()).seconds)));
    setOnSystemVolume(proxy->onSystemPartition);
    setLocalizedName(sharing(proxy->localizedName, {info[manifest::bundleDisplayName], info[manifest::bundleName]}));
    setLocalizedShortName(sharing(proxy->localizedShortName, {info[manifest::bundleName]}));
    setLocalizedContainingName(container ? valueOrAbsent(container->localizedName) : Value());
    setLocalizedFilevaneActionNames(
        ZBDPluginAdditions::localizedFilevaneActionNamesForZBDict(_platform.registry, *proxy, declared));
    setOriginalIdentifier(sharing(proxy->originalIdentifier, {identifier()}));
    setEntitlements(valueOrAbsent(proxy->entitlements));
    if (proxy->dataContainerURL) _dataContainerURL = {proxy, &*proxy->dataContainerURL};
    _infoVlist.set(valueOrAbsent(proxy->infoDictionary));
    if (const Value stated = declared[manifest::hubProtocolVersion]) {
        setHubProtocolVersion(static_cast<std::uint64_t>(stated.integerValue().value_or(0)));
    } else {
        setHubProtocolVersion(infoKey(manifest::zembra) ? 1 : 2);
    }
    setContainingUrl(container ? std::optional(container->bundleURL) : std::nullopt);

    if (const auto error = diagnose()) {
        log::ops().info("ignoring mis-configured plug-in at %@: %{public}@", path(), *error);
        return false;
    }
    return true;
}

platform::Failure ZBDPlugIn::diagnose() const {
    if (auto error = ZBPlugInCore::diagnose()) return error;
    if (!isData() && !dataContainerURL()) {
        return zembra::errorWithCode(zembra::code::configuration, "this plug-in has no sandbox data container");
    }
    if (!containingUrl() && !path().starts_with(_platform.files.locate("/System/"))) {
        return zembra::errorWithCode(zembra::code::configuration,
                                     "plug-ins outside containing apps must be in /System");
    }
    return std::nullopt;
}

PlugInProxyRef ZBDPlugIn::getProxy() const {
    if (auto proxy = _platform.registry.plugInForUUID(*uuid())) return proxy;
    log::cx().notice("Failed to find Plugin by %{uuid_t}.16P fallback to path %@", *uuid(), url());
    return _platform.registry.plugInForURL(*url());
}

void ZBDPlugIn::refreshInfo() const {
    const auto knowledge = _platform.registry.knowledgeUUID();
    if (knowledge && _cxKnowledgeUUID.read([&](const auto& known) { return known == knowledge; })) return;
    const std::lock_guard lock(_refreshLock);
    if (const auto proxy = getProxy()) {
        _infoVlist.set(valueOrAbsent(proxy->infoDictionary));
    } else {
        log::ops().error("could not obtain fresh proxy for %@", uuid());
        _infoVlist.set(Value());
    }
    _cxKnowledgeUUID.set(knowledge);
}

Value ZBDPlugIn::currentInfo() const {
    refreshInfo();
    return _infoVlist.get();
}

std::optional<Dictionary> ZBDPlugIn::bundleInfoDictionary() const { return currentInfo().dictionary(); }

Value ZBDPlugIn::infoKey(std::string_view key) const {
    const auto info = bundleInfoDictionary();
    return info ? (*info)[key] : Value();
}

Value ZBDPlugIn::pluginKey(std::string_view key) const {
    const auto declared = infoKey(manifest::extension).dictionary();
    return declared ? (*declared)[key] : Value();
}

Value ZBDPlugIn::attribute(std::string_view key) const {
    const auto declared = pluginKey(manifest::attributes).dictionary();
    return declared ? (*declared)[key] : Value();
}

MutableDictionary ZBDPlugIn::prunedInfoDictionaryFor(const Dictionary& dictionary) {
    MutableDictionary pruned;
    for (const auto& entry : dictionary) {
        if (!entry.name().starts_with("DT")) pruned.set(entry.name(), entry.value);
    }
    return pruned;
}

void ZBDPlugIn::setLocalizedName(Value value) {
    ZBPlugInCore::setLocalizedName(std::move(value));
    forgetForm(); // it shows the old name
}

void ZBDPlugIn::setLocalizedShortName(Value value) {
    ZBPlugInCore::setLocalizedShortName(std::move(value));
    forgetForm();
}

void ZBDPlugIn::setLocalizedContainingName(Value value) {
    ZBPlugInCore::setLocalizedContainingName(std::move(value));
    forgetForm();
}

void ZBDPlugIn::setLocalizedFilevaneActionNames(Value value) {
    ZBPlugInCore::setLocalizedFilevaneActionNames(std::move(value));
    forgetForm();
}

namespace {

/// Whoever reads the debug lines of exports and tokens sees them for every form.
bool mayKeepForms() {
    return !log::cx().isEnabled(platform::LogLevel::debug) && !log::sandbox().isEnabled(platform::LogLevel::debug);
}

} // namespace

KeptFormRef ZBDPlugIn::keptForm() const {
    auto kept = _keptForm.get();
    if (!kept || !mayKeepForms()) return nullptr;
    refreshInfo();
    const bool isCurrent = _infoVlist.read([&](const Value& manifest) { return kept->manifest.isStorageOf(manifest); });
    return isCurrent ? std::move(kept) : nullptr;
}

bool ZBDPlugIn::isComplete(const KeptForm& kept, const FormCompletion& now) const {
    const auto last = kept.lastCompletion.get();
    return last.annotationsVersion == now.annotationsVersion &&
           now.time - last.time < _platform.sandbox.repeatInterval();
}

bool ZBDPlugIn::requiresEntitlement() const { return static_cast<bool>(pluginKey(manifest::hostEntitlement)); }

std::string ZBDPlugIn::listing() const { return platform::format("%@(%@) %@", identifier(), version(), uuidText()); }

MutableDictionary ZBDPlugIn::currentForm(platform::Failure* error, const KeptFormRef& known) const {
    if (known) return MutableDictionary::extending(known->form);
    const auto manifest = bundleInfoDictionary();
    platform::Failure failure;
    MutableDictionary form = exportForm(&failure);
    if (failure) {
        if (error) *error = std::move(failure);
        return form;
    }
    const auto [number, isAgain] = _recentForms->countMade(_lastMade);
    _lastMade = number;
    if (!manifest || !isAgain || !mayKeepForms()) return form;
    const Dictionary kept = form.keepingEncoding();
    const auto version = this->version() ? kept.string(zembra::formKey::version) : std::nullopt;
    keepForm({.manifest = *manifest,
              .form = kept,
              .tokens = tokenNeeds(),
              .facts = {*identifier().string(), version, onSystemVolume(), lastModified()},
              .listing = listing(),
              .isContained = isContained(),
              .isDedicated = isDedicated(),
              .requiresEntitlement = requiresEntitlement(),
              .replacesOthers = static_cast<bool>(valueForEntitlement(zembra::entitlement::replacePlugIn)),
              .lastCompletion = {}});
    _recentForms->keep(weak_from_this());
    return form;
}

void ZBDPlugIn::keepForm(KeptForm kept) const { _keptForm.set(std::make_shared<const KeptForm>(std::move(kept))); }

Value ZBDPlugIn::valueForEntitlement(std::string_view key) const {
    const auto entitlements = this->entitlements();
    return entitlements ? (*entitlements)[key] : Value();
}

bool ZBDPlugIn::hasEntitlement(std::string_view key) const {
    const Value value = valueForEntitlement(key);
    return value && !(value == Value(false));
}

std::string ZBDPlugIn::annotationKey() const {
    const Value replaced = valueForEntitlement(zembra::entitlement::replacePlugIn);
    return std::string(replaced.string() ? *replaced.string() : *identifier().string());
}

Dictionary ZBDPluginAdditions::localizedFilevaneActionNamesForZBDict(platform::Registry& registry,
                                                                     const platform::PlugInProxy& proxy,
                                                                     const Dictionary& plugInDictionary) {
    std::set<std::string> names;
    const auto actions = plugInDictionary.array(manifest::filevaneActions).value_or(platform::Array());
    for (const Value& action : actions) {
        const auto dictionary = action.dictionary();
        const auto name = dictionary ? dictionary->string(manifest::filevaneActionName) : std::nullopt;
        if (name) {
            names.emplace(*name);
        } else {
            log::cx().error("missing VKExtensionFilevaneActionName for plugin %@", proxy);
        }
    }
    static const Dictionary none; // which most have
    if (names.empty()) return none;
    MutableDictionary titles;
    const auto localized = registry.localizedStrings(proxy, names, "Localizable");
    for (const std::string& name : names) {
        const auto found = localized.find(name);
        titles.set(name, found == localized.end() ? name : found->second);
    }
    return titles;
}

} // namespace zbd
