#include "Zembra/ZBPlugInCore.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBUtilities.h"

namespace zembra {

using platform::Dictionary;
using platform::Failure;
using platform::MutableArray;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;
using platform::Value;

namespace {

Value entry(const std::optional<Dictionary>& dictionary, std::string_view key) {
    return dictionary ? (*dictionary)[key] : Value();
}

Value stringOnly(Value value) { return value.kind() == platform::Kind::string ? std::move(value) : Value(); }

/// The value with its own top-level storage, so that its giver's later changes do not reach it.
Value copyOf(const Value& value) {
    if (const auto dictionary = value.dictionary()) return MutableDictionary::copyOf(*dictionary);
    if (const auto array = value.array()) return MutableArray::copyOf(*array);
    return value;
}

template <class... Args>
platform::Error configurationError(platform::FormatString<std::type_identity_t<Args>...> text, const Args&... args) {
    return errorWithCode(code::configuration, platform::format<Args...>(text, args...));
}

} // namespace

std::shared_ptr<ZBPlugInCore> ZBPlugInCore::initWithName(const Value& identifier, const std::optional<URL>& url,
                                                         const Value& bundleInfo, const Value& info,
                                                         const std::optional<UUID>& uuid) {
    auto plugIn = std::make_shared<ZBPlugInCore>();
    return plugIn->initializeWithName(identifier, url, bundleInfo, info, uuid) ? plugIn : nullptr;
}

std::shared_ptr<ZBPlugInCore> ZBPlugInCore::initWithForm(const Dictionary& form) {
    auto plugIn = std::make_shared<ZBPlugInCore>();
    return plugIn->setupWithForm(form) ? plugIn : nullptr;
}

bool ZBPlugInCore::initializeWithName(const Value& identifier, const std::optional<URL>& url, const Value& bundleInfo,
                                      const Value& info, const std::optional<UUID>& uuid) {
    if (!setupWithName(identifier, url, bundleInfo, info, uuid)) return false;
    if (!_plugInDictionary) setPlugInDictionary(info);
    return true;
}

bool ZBPlugInCore::setupWithName(const Value& identifier, const std::optional<URL>& url, const Value& bundleInfo,
                                 const Value&, const std::optional<UUID>& uuid) {
    if (!url) return false;
    if (!identifier.string()) {
        log::ops().error("missing identifier in plug-in at %@", url->path());
        return false;
    }
    if (bundleInfo) {
        const Value normalized = normalizeInfoDictionary(bundleInfo);
        if (!setDictionaries(normalized)) {
            log::ops().notice("malformed plug-in dictionary in plug-in %@ at %@: %@", identifier, url->absoluteString(),
                              bundleInfo);
            return false;
        }
        log::cx().debug("%s %@", __func__, entry(normalized.dictionary(), manifest::bundleDisplayName));
    }
    setIdentifier(identifier);
    setUrl(url);
    setUuid(uuid ? uuid : UUID::random());
    return true;
}

bool ZBPlugInCore::setDictionaries(const Value& dictionary) {
    const auto bundleInfo = dictionary.dictionary();
    if (!bundleInfo) return false;
    setBundleInfoDictionary(dictionary);
    log::ops().debug("%s %@", __func__, (*bundleInfo)[manifest::bundleDisplayName]);
    const auto plugIn = bundleInfo->dictionary(manifest::extension);
    if (!plugIn) return false;
    setPlugInDictionary(*plugIn);
    if (plugIn->contains(manifest::multiple)) {
        log::ops().notice("multiplexed plug-ins (%{public}@ key) obsolete and ignored", manifest::multiple);
    }
    return true;
}

void ZBPlugInCore::setLocation(LocationField& field, const std::optional<URL>& url) {
    Location location;
    if (url) {
        location.path = url->path();
        if (!(URL::file(*location.path.string()) == *url)) location.text = url->absoluteString();
    }
    field.set(std::move(location));
}

std::optional<URL> ZBPlugInCore::urlOf(const Location& location) {
    if (const auto text = location.text.string()) return URL::parse(*text);
    const auto path = location.path.string();
    return path ? std::optional(URL::file(*path)) : std::nullopt;
}

std::optional<URL> ZBPlugInCore::url() const { return urlOf(_url.get()); }

void ZBPlugInCore::setUrl(const std::optional<URL>& value) { setLocation(_url, value); }

std::optional<URL> ZBPlugInCore::containingUrl() const { return urlOf(_containingUrl.get()); }

void ZBPlugInCore::setContainingUrl(const std::optional<URL>& value) { setLocation(_containingUrl, value); }

std::optional<Dictionary> ZBPlugInCore::bundleInfoDictionary() const {
    return _bundleInfoDictionary.get().dictionary();
}

std::optional<Dictionary> ZBPlugInCore::localizedFilevaneActionNames() const {
    return _localizedFilevaneActionNames.get().dictionary();
}

void ZBPlugInCore::setLocalizedFilevaneActionNames(Value value) { _localizedFilevaneActionNames.set(std::move(value)); }

void ZBPlugInCore::setUuid(const std::optional<UUID>& value) {
    _identity.set({value, value ? Value(value->text()) : Value()});
}

Value ZBPlugInCore::infoKey(std::string_view key) const {
    Value value = entry(bundleInfoDictionary(), key);
    log::cx().debug("%s %@ => %@", __func__, key, value);
    return value;
}

Value ZBPlugInCore::pluginKey(std::string_view key) const { return entry(plugInDictionary(), key); }

Value ZBPlugInCore::attribute(std::string_view key) const { return entry(attributes(), key); }

bool ZBPlugInCore::oldStyle() const {
    if (infoKey(manifest::extension)) return false;
    if (infoKey(manifest::zembra)) return true;
    fatalInternalError("unknown plug-in configuration style");
}

/// As the file system has it: a path that is no UTF-8 is in the URL alone.
std::string ZBPlugInCore::pathOf(const Location& location) {
    if (location.text) return urlOf(location)->path();
    return std::string(location.path.string().value_or(""));
}

std::string ZBPlugInCore::path() const { return pathOf(_url.get()); }

Value ZBPlugInCore::containingPath() const {
    return _containingUrl.read([](const Location& location) { return location.path; });
}

bool ZBPlugInCore::beginsWithContainingPath(std::string_view path) const {
    return _containingUrl.read([&](const Location& location) {
        return location.text ? path.starts_with(pathOf(location)) : location.path.isBeginningOf(path);
    });
}

std::optional<Dictionary> ZBPlugInCore::attributes() const { return pluginKey(manifest::attributes).dictionary(); }

Value ZBPlugInCore::version() const { return stringOnly(attribute(manifest::version)); }

Value ZBPlugInCore::protocolSpec() const {
    if (Value protocol = pluginKey(manifest::protocol)) return protocol;
    return isAppExtension() ? Value(manifest::objectProtocol) : Value();
}

Value ZBPlugInCore::principalSpec() const {
    if (Value principal = pluginKey(manifest::principalClass)) return principal;
    return isAppExtension() ? Value(manifest::objectProtocol) : Value();
}

Value ZBPlugInCore::sdkSpec() const { return pluginKey(manifest::pointIdentifier); }

Value ZBPlugInCore::embeddedProtocolSpec() const {
    Value embedded = pluginKey(manifest::embeddedProtocol);
    return embedded ? embedded : protocolSpec();
}

bool ZBPlugInCore::isAppExtension() const {
    const Value path = _url.get().path;
    return path && path.string()->ends_with(manifest::appExtensionSuffix);
}

bool ZBPlugInCore::isHybrid() const { return static_cast<bool>(pluginKey(manifest::embeddedCode)); }

bool ZBPlugInCore::isDedicated() const { return pluginKey(manifest::dedicated).booleanValue().value_or(false); }

bool ZBPlugInCore::isData() const { return protocolSpec().string() == manifest::dataProtocol; }

bool ZBPlugInCore::isEqual(const ZBPlugInCore& other) const {
    const auto own = uuid();
    if (!own) fatalInternalError("self.uuid");
    return own == other.uuid();
}

std::size_t ZBPlugInCore::hash() const {
    const auto own = uuid();
    if (!own) fatalInternalError("self.uuid");
    return std::hash<UUID>()(*own);
}

Failure ZBPlugInCore::diagnose() const {
    if (!identifier()) {
        return configurationError("missing identifier (no VKExtensionIdentifier, nor even VBBundleIdentifier)");
    }
    if (!protocolSpec()) {
        return configurationError("missing \"%@\" key in Info.vlist or SDK", manifest::protocol);
    }
    if (!attributes()) {
        return configurationError("missing \"%@\" key in Info.vlist or SDK", manifest::attributes);
    }
    if (isAppExtension() && principalSpec().string() != manifest::objectProtocol) {
        return configurationError("Application Extensions may not use the \"%@\" key", manifest::principalClass);
    }
    if (pluginKey(manifest::passProxy)) {
        return configurationError("the \"%@\" key is not supported on this platform", manifest::passProxy);
    }
    if (isHybrid()) return configurationError("hybrid plug-ins are not supported on this platform");
    return std::nullopt;
}

std::shared_ptr<platform::Interface> ZBPlugInCore::augmentInterface(const std::shared_ptr<platform::Interface>&) const {
    return nullptr;
}

void ZBPlugInCore::setAnnotation(std::string_view key, const Value& value) {
    if (const auto changed = dictionaryChanging(annotations(), key, copyOf(value))) setAnnotations(*changed);
}

void ZBPlugInCore::updateFromForm(const Dictionary& form) { setAnnotations(form[formKey::annotations]); }

void ZBPlugInCore::canonicalize() {
    MutableDictionary attributes = MutableDictionary::copyOf(this->attributes().value_or(Dictionary()));
    MutableDictionary plugIn = MutableDictionary::copyOf(plugInDictionary().value_or(Dictionary()));
    plugIn.set(manifest::attributes, attributes);
    setPlugInDictionary(plugIn);
    if (this->attribute(manifest::version)) return;
    const Value bundleVersion = infoKey(manifest::bundleShortVersionString);
    attributes.set(manifest::version, bundleVersion ? bundleVersion : Value("1"));
}

std::string ZBPlugInCore::description() const {
    // Every "find" logs it, so it is put together without the formatter.
    std::string text;
    for (const Value& part : {identifier(), uuidText(), _url.get().path}) {
        if (!text.empty()) text += ' ';
        text += part.string().value_or("(null)");
    }
    return text;
}

} // namespace zembra
