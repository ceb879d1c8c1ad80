#include "Zembra/ZBPlugInCore.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBUtilities.h"

#include <utility>

namespace zembra {

using platform::Array;
using platform::Dictionary;
using platform::Failure;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;
using platform::Value;

namespace {

/// All keys of a form in their order. Forms begin as copies of it, because a copy shares the texts of the keys, and
/// forms are made by the thousand.
const Dictionary& formLayout() {
    static const Dictionary layout = [] {
        MutableDictionary keys;
        for (const std::string_view key :
             {formKey::hubProtocolVersion, formKey::path, formKey::systemResident, formKey::identifier,
              formKey::originalIdentifier, formKey::version, formKey::bundleInfo, formKey::info, formKey::uuid,
              formKey::lastModified, formKey::annotations, formKey::entitlements, formKey::containingPath,
              formKey::localizedContainingName, formKey::localizedName, formKey::localizedShortName,
              formKey::localizedFilevaneActionNames}) {
            keys.set(key, false);
        }
        return keys;
    }();
    return layout;
}

/// The dictionary; or, where a form brought in another kind of value, that value as it came.
Value dictionaryOr(const std::optional<Dictionary>& dictionary, Value asItCame) {
    return dictionary ? Value(*dictionary) : std::move(asItCame);
}

} // namespace

MutableDictionary ZBPlugInCore::exportForm(Failure* error) const {
    MutableDictionary form = MutableDictionary::copyOf(formLayout());
    const auto setOptional = [&](std::string_view key, Value value) {
        if (value) {
            form.set(key, std::move(value));
        } else {
            form.remove(key);
        }
    };
    const auto setRequired = [&](std::string_view key, Value value) {
        if (!value && error && !*error) {
            *error = errorWithCode(code::configuration, "the plug-in has no \"%@\"", key);
        }
        setOptional(key, std::move(value));
    };

    std::optional<MutableDictionary> bundleInfo;
    if (const auto current = bundleInfoDictionary()) {
        bundleInfo = MutableDictionary::copyOf(*current);
        bundleInfo->remove(manifest::bundleInfoVlistURL);
    }
    const Value version = this->version();
    const Value annotations = _annotations.get();
    const Value localizedName = this->localizedName();

    form.set(formKey::hubProtocolVersion, hubProtocolVersion());
    setRequired(formKey::path, _url.get().path);
    form.set(formKey::systemResident, onSystemVolume());
    setRequired(formKey::identifier, identifier());
    setRequired(formKey::originalIdentifier, originalIdentifier());
    form.set(formKey::version, version ? version : Value("<none>"));
    setRequired(formKey::bundleInfo, valueOrAbsent(bundleInfo));
    setRequired(formKey::info, _plugInDictionary);
    setRequired(formKey::uuid, uuidText());
    form.set(formKey::lastModified, lastModified());
    form.set(formKey::annotations, annotations ? annotations : Value(Dictionary()));

    setOptional(formKey::entitlements, dictionaryOr(entitlements(), _entitlements.get()));
    setOptional(formKey::containingPath, containingPath());
    setOptional(formKey::localizedContainingName, localizedContainingName());
    setOptional(formKey::localizedName, localizedName);
    setOptional(formKey::localizedShortName, localizedShortName());
    setOptional(formKey::localizedFilevaneActionNames,
                dictionaryOr(localizedFilevaneActionNames(), _localizedFilevaneActionNames.get()));

    // The form holds this same dictionary, so hosts that only read the bundle info see the localized name too.
    if (localizedName && bundleInfo) {
        log::cx().debug("%s BundleInfo[BundleDisplayName] was %@", "export",
                        (*bundleInfo)[manifest::bundleDisplayName]);
        bundleInfo->set(manifest::bundleDisplayName, localizedName);
        log::cx().debug("%s BundleInfo[BundleDisplayName] is %@", "export", localizedName);
    }
    return form;
}

bool ZBPlugInCore::setupWithForm(const Dictionary& form) {
    const auto path = form.string(formKey::path);
    const auto uuidText = form.string(formKey::uuid);
    if (!setupWithName(form[formKey::identifier], path ? std::optional<URL>(URL::file(*path)) : std::nullopt,
                       form[formKey::bundleInfo], form[formKey::info],
                       uuidText ? UUID::parse(*uuidText) : std::nullopt)) {
        return false;
    }
    const Value hub = form[formKey::hubProtocolVersion];
    setHubProtocolVersion(hub ? static_cast<std::uint64_t>(hub.integerValue().value_or(0)) : 1);
    setOriginalIdentifier(form[formKey::originalIdentifier]);
    setCdhash(form[formKey::hash]);
    setRequirement(form[formKey::requirement]);
    setLastModified(form[formKey::lastModified].integerValue().value_or(0));
    setEntitlements(form[formKey::entitlements]);
    if (const auto containing = form.string(formKey::containingPath)) setContainingUrl(URL::file(*containing));
    setOnSystemVolume(form[formKey::systemResident].booleanValue().value_or(false));
    setAnnotations(form[formKey::annotations]);
    setLocalizedName(form[formKey::localizedName]);
    setLocalizedShortName(form[formKey::localizedShortName]);
    setLocalizedContainingName(form[formKey::localizedContainingName]);
    setLocalizedFilevaneActionNames(form[formKey::localizedFilevaneActionNames]);
    return true;
}

void ZBPlugInCore::localizedInfoDictionaryForKeys(const Array& keys, const LocalizedInfoCompletion& completion) const {
    const auto finish = [&](const std::optional<Dictionary>& values, const Failure& error) {
        log::cx().debug("localized values %@", valueOrAbsent(values));
        completion(values, error);
    };
    // The stored bundle info, not what a subclass looks up: a record without its own has nothing to localize.
    const auto stored = _bundleInfoDictionary.get().dictionary();
    if (!stored) {
        return finish(std::nullopt, errorWithCode(code::unresolvable, "Unable to resolve plugin for %@", identifier()));
    }
    MutableDictionary values;
    for (const Value& keyValue : keys) {
        const auto key = keyValue.string();
        if (!key) continue;
        Value value;
        if (*key == manifest::bundleName) value = localizedShortName();
        if (*key == manifest::bundleDisplayName) value = localizedName();
        if (!value) value = infoKey(*key);
        if (!value) value = (*stored)[*key];
        if (!value) continue;
        // A message may bring a UUID into bundle info; property lists hold none.
        if (value.kind() == platform::Kind::uuid) {
            return finish(
                std::nullopt,
                errorWithCode(code::unresolvable,
                              "Value of info dictionary key \"%@\" for plugin %@ does not conform to secure coding!",
                              *key, identifier()));
        }
        values.set(*key, value);
    }
    finish(values, std::nullopt);
}

} // namespace zembra
