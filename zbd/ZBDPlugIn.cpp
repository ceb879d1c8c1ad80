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

std::shared_ptr<ZBDPlugIn> ZBDPlugIn::initWithCXData(platform::Platform& platform, const PlugInProxyRef& proxy) {
    std::shared_ptr<ZBDPlugIn> self(new ZBDPlugIn(platform));
    return self->setupWithProxy(proxy) ? self : nullptr;
}

bool ZBDPlugIn::setupWithProxy(const PlugInProxyRef& proxy) {
    if (!proxy->bundleURL) return false;
    if (!initializeWithName(valueOrAbsent(proxy->plugInIdentifier), proxy->bundleURL, Value(),
                            valueOrAbsent(proxy->plugInDictionary), proxy->uuid)) {
        return false;
    }
    const Dictionary declared = proxy->plugInDictionary.value_or(Dictionary());
    const auto& container = proxy->containingBundle;

    setLastModified(static_cast<std::int64_t>(std::trunc(proxy->registrationDate.value_or(platform::Date()).seconds)));
    setOnSystemVolume(proxy->onSystemPartition);
    setLocalizedName(valueOrAbsent(proxy->localizedName));
    setLocalizedShortName(valueOrAbsent(proxy->localizedShortName));
    setLocalizedContainingName(container ? valueOrAbsent(container->localizedName) : Value());
    setLocalizedFilevaneActionNames(
        ZBDPluginAdditions::localizedFilevaneActionNamesForZBDict(_platform.registry, *proxy, declared));
    _originalIdentifier = valueOrAbsent(proxy->originalIdentifier);
    _entitlements = proxy->entitlements;
    _dataContainerURL = proxy->dataContainerURL;
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

Value ZBDPlugIn::currentInfo() const {
    const auto knowledge = _platform.registry.knowledgeUUID();
    if (knowledge && knowledge == _cxKnowledgeUUID.get()) return _infoVlist.get();
    {
        const std::lock_guard lock(_refreshLock);
        if (const auto proxy = getProxy()) {
            _infoVlist.set(valueOrAbsent(proxy->infoDictionary));
        } else {
            log::ops().error("could not obtain fresh proxy for %@", uuid());
            _infoVlist.set(Value());
        }
        _cxKnowledgeUUID.set(knowledge);
    }
    return _infoVlist.get();
}

std::optional<Dictionary> ZBDPlugIn::bundleInfoDictionary() const { return currentInfo().dictionary(); }

Value ZBDPlugIn::infoKey(std::string_view key) const {
    const auto info = bundleInfoDictionary();
    return info ? (*info)[key] : Value();
}

Value ZBDPlugIn::pluginKey(std::string_view key) const {
    const auto extension = infoKey(manifest::extension).dictionary();
    return extension ? (*extension)[key] : Value();
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

std::optional<Dictionary> ZBDPlugIn::localizedFilevaneActionNames() const {
    return _localizedFilevaneActionNames.get().dictionary();
}

void ZBDPlugIn::setLocalizedFilevaneActionNames(Value value) {
    setLocalized(_localizedFilevaneActionNames, std::move(value));
}

void ZBDPlugIn::setLocalized(zembra::AtomicField<Value>& field, Value value) {
    field.set(std::move(value));
    _keptForm.set(nullptr); // it shows the old name
}

MutableDictionary ZBDPlugIn::currentForm(platform::Failure* error) const {
    const auto manifest = bundleInfoDictionary();
    // Whoever reads the debug lines of the export sees them for every form.
    const bool mayKeep = manifest && !log::cx().isEnabled(platform::LogLevel::debug);
    if (const auto kept = mayKeep ? _keptForm.get() : nullptr; kept && kept->manifest.sharesStorageWith(*manifest)) {
        return MutableDictionary::copyOf(kept->form);
    }
    platform::Failure failure;
    MutableDictionary form = exportForm(&failure);
    if (failure) {
        if (error) *error = std::move(failure);
        return form;
    }
    if (!mayKeep) return form;
    for (const auto key : {zembra::formKey::bundleInfo, zembra::formKey::info, zembra::formKey::entitlements}) {
        if (const auto part = form.dictionary(key)) form.set(key, part->keepingEncoding());
    }
    _keptForm.set(std::make_shared<const KeptForm>(KeptForm{*manifest, MutableDictionary::copyOf(form)}));
    return form;
}

Value ZBDPlugIn::valueForEntitlement(std::string_view key) const {
    return _entitlements ? (*_entitlements)[key] : Value();
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
    MutableDictionary titles;
    if (names.empty()) return titles;
    const auto localized = registry.localizedStrings(proxy, names, "Localizable");
    for (const std::string& name : names) {
        const auto found = localized.find(name);
        titles.set(name, found == localized.end() ? name : found->second);
    }
    return titles;
}

} // namespace zbd
