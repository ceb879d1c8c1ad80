#pragma once

#include "Zembra/AtomicField.h"
#include "platform/Error.h"
#include "platform/PropertyList.h"
#include "platform/Url.h"
#include "platform/Uuid.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace platform {
class Interface;
class Registry;
} // namespace platform

namespace zembra {

/// The record of one plug-in: a bundle directory together with what its manifest says about it.
///
/// A string that may be absent is a `Value` here, of kind string or absent: as forms, rules and log lines want it, and
/// handed on without copying the text. Setters keep what they are given, so a dictionary that its giver changes later
/// changes in the record too.
///
/// Fields may be read and set from any thread, except `plugInDictionary`: that is set only before the record is shared.
/// Once set up, `uuid`, `identifier` and `url` are always there and never change.
class ZBPlugInCore {
public:
    using LocalizedInfoCompletion =
        std::function<void(const std::optional<platform::Dictionary>& values, const platform::Failure& error)>;

    /// An empty record: every field absent, false or 0.
    ZBPlugInCore() = default;
    virtual ~ZBPlugInCore() = default;
    ZBPlugInCore(const ZBPlugInCore&) = delete;
    ZBPlugInCore& operator=(const ZBPlugInCore&) = delete;

    /// A record set up with `setupWithName`; null when that fails. When there is no bundle info, `info` is its plug-in
    /// dictionary.
    static std::shared_ptr<ZBPlugInCore> initWithName(const platform::Value& identifier,
                                                      const std::optional<platform::URL>& url,
                                                      const platform::Value& bundleInfo, const platform::Value& info,
                                                      const std::optional<platform::UUID>& uuid);
    /// A record set up with `setupWithForm`; null when that fails.
    static std::shared_ptr<ZBPlugInCore> initWithForm(const platform::Dictionary& form);

    // Setting up. Each answers whether it succeeded; why it did not is logged. A record whose setup failed is to be
    // dropped.

    /// An identifier that is no string counts as missing. `bundleInfo` may be absent. Without a UUID the record gets a
    /// random one. `info` is not used: subclasses may.
    virtual bool setupWithName(const platform::Value& identifier, const std::optional<platform::URL>& url,
                               const platform::Value& bundleInfo, const platform::Value& info,
                               const std::optional<platform::UUID>& uuid);
    virtual bool setupWithForm(const platform::Dictionary& form);
    /// Takes the dictionary as bundle info and the plug-in dictionary in it. False when it is no dictionary (nothing is
    /// stored then), or has no plug-in dictionary (only the bundle info is stored then).
    bool setDictionaries(const platform::Value& dictionary);
    /// A hook that sees the bundle info before it is accepted.
    virtual platform::Value normalizeInfoDictionary(const platform::Value& dictionary) { return dictionary; }

    // Fields.

    bool onSystemVolume() const { return _onSystemVolume; }
    void setOnSystemVolume(bool value) { _onSystemVolume = value; }
    std::optional<platform::Dictionary> plugInDictionary() const { return _plugInDictionary.dictionary(); }
    void setPlugInDictionary(platform::Value value) { _plugInDictionary = std::move(value); }
    platform::Value identifier() const { return _identifier.get(); }
    void setIdentifier(platform::Value value) { _identifier.set(std::move(value)); }
    virtual platform::Value originalIdentifier() const { return _originalIdentifier.get(); }
    void setOriginalIdentifier(platform::Value value) { _originalIdentifier.set(std::move(value)); }
    std::optional<platform::URL> url() const;
    void setUrl(const std::optional<platform::URL>& value);
    /// Of the application around the plug-in; none for a plug-in outside any.
    std::optional<platform::URL> containingUrl() const;
    void setContainingUrl(const std::optional<platform::URL>& value);
    virtual std::optional<platform::Dictionary> bundleInfoDictionary() const;
    void setBundleInfoDictionary(platform::Value value) { _bundleInfoDictionary.set(std::move(value)); }
    virtual std::optional<platform::Dictionary> entitlements() const { return _entitlements.get().dictionary(); }
    void setEntitlements(platform::Value value) { _entitlements.set(std::move(value)); }
    std::uint64_t hubProtocolVersion() const { return _hubProtocolVersion; }
    void setHubProtocolVersion(std::uint64_t value) { _hubProtocolVersion = value; }
    virtual platform::Value localizedName() const { return _localizedName.get(); }
    virtual void setLocalizedName(platform::Value value) { _localizedName.set(std::move(value)); }
    virtual platform::Value localizedShortName() const { return _localizedShortName.get(); }
    virtual void setLocalizedShortName(platform::Value value) { _localizedShortName.set(std::move(value)); }
    virtual platform::Value localizedContainingName() const { return _localizedContainingName.get(); }
    virtual void setLocalizedContainingName(platform::Value value) { _localizedContainingName.set(std::move(value)); }
    /// Action name to localized title.
    virtual std::optional<platform::Dictionary> localizedFilevaneActionNames() const;
    virtual void setLocalizedFilevaneActionNames(platform::Value value);
    std::optional<platform::Dictionary> annotations() const { return _annotations.get().dictionary(); }
    void setAnnotations(platform::Value value) { _annotations.set(std::move(value)); }
    /// When the plug-in was registered, in seconds since 1970-01-01 00:00 UTC.
    std::int64_t lastModified() const { return _lastModified; }
    void setLastModified(std::int64_t value) { _lastModified = value; }
    std::optional<platform::UUID> uuid() const {
        return _identity.read([](const Identity& identity) { return identity.uuid; });
    }
    void setUuid(const std::optional<platform::UUID>& value);
    /// The text form of `uuid`, made once.
    platform::Value uuidText() const { return _identity.get().text; }
    /// Data: the code-directory hash of the plug-in's signature.
    platform::Value cdhash() const { return _cdhash.get(); }
    void setCdhash(platform::Value value) { _cdhash.set(std::move(value)); }
    platform::Value requirement() const { return _requirement.get(); }
    void setRequirement(platform::Value value) { _requirement.set(std::move(value)); }
    virtual std::optional<platform::URL> dataContainerURL() const { return std::nullopt; }

    // Look-ups; absent when there is no such key.

    /// In the bundle info.
    virtual platform::Value infoKey(std::string_view key) const;
    /// In the plug-in dictionary.
    virtual platform::Value pluginKey(std::string_view key) const;
    /// In the attributes.
    virtual platform::Value attribute(std::string_view key) const;

    // Derived properties, computed on each read.

    /// Whether the older manifest dictionary configures the plug-in. Asking a record that has neither stops the
    /// process.
    bool oldStyle() const;
    /// Without a trailing separator; empty for a record without `url`.
    std::string path() const;
    platform::Value containingPath() const;
    bool isContained() const {
        return _containingUrl.read([](const Location& location) { return static_cast<bool>(location.path); });
    }
    /// Whether `path` begins with the path of the application around the plug-in, byte for byte. False without one.
    bool beginsWithContainingPath(std::string_view path) const;
    std::optional<platform::Dictionary> attributes() const;
    /// Absent also when the manifest has no string there.
    platform::Value version() const;
    /// A string or an array of strings, as the manifest has it.
    platform::Value protocolSpec() const;
    platform::Value principalSpec() const;
    /// The extension point; whatever the manifest has there.
    platform::Value sdkSpec() const;
    platform::Value embeddedCodePath() const { return {}; }
    platform::Value embeddedProtocolSpec() const;
    bool isAppExtension() const;
    bool isMultiplexed() const { return false; }
    /// With embedded code.
    bool isHybrid() const;
    /// Offered only to the application whose own plug-ins directory holds it.
    bool isDedicated() const;
    /// Without code to launch.
    bool isData() const;
    platform::Date timestamp() const { return {static_cast<double>(lastModified())}; }

    /// Records are equal when their UUIDs are. Asking a record without one to compare or hash stops the process.
    bool isEqual(const ZBPlugInCore& other) const;
    std::size_t hash() const;
    friend bool operator==(const ZBPlugInCore& left, const ZBPlugInCore& right) { return left.isEqual(right); }

    /// The first configuration error. Nothing is logged.
    virtual platform::Failure diagnose() const;
    /// A hook for subclasses.
    virtual std::shared_ptr<platform::Interface> augmentInterface(const std::shared_ptr<platform::Interface>&) const;

    // Changes.

    /// Replaces `annotations` by a dictionary with a copy of `value` under `key`, or without the key when `value` is
    /// absent. A record without annotations stays without.
    void setAnnotation(std::string_view key, const platform::Value& value);
    /// Takes the annotations of a form, and nothing else.
    void updateFromForm(const platform::Dictionary& form);
    /// Replaces the plug-in dictionary by one that has attributes, and a version in them.
    void canonicalize();

    // The extension point's defaults.

    /// None, and logged, when no such extension point is registered.
    static std::optional<platform::Dictionary> readSDKDictionary(platform::Registry& registry,
                                                                 std::string_view extensionPoint);
    /// Merges the defaults under the bundle info, then canonicalizes. The record must have bundle info.
    void resolveSDK(platform::Registry& registry);
    /// A new dictionary: the plug-in's values before the SDK's, at every depth.
    static platform::MutableDictionary mergeDictionary(const platform::Dictionary& sdk,
                                                       const platform::Dictionary& plugIn);
    /// Whether the SDK's value wins.
    static bool sdkOverridesKey(std::string_view key);
    /// The elements of both, each once.
    static platform::Array mergeSharedResources(const platform::Array& sdk, const platform::Array& plugIn);

    // The form: the dictionary by which the record travels.

    /// A new form, whose "bundleInfo" is its own and whose other dictionaries are the record's. A form always comes
    /// back: a value that the record should have but lacks (which happens when a plug-in vanishes between look-up and
    /// reply) is left out, and the first such value is reported through `error` unless that is null.
    platform::MutableDictionary exportForm(platform::Failure* error) const;
    /// Values of the bundle info, localized where the record knows better. Calls `completion` once, before it returns:
    /// with the values found, or with none and an error.
    void localizedInfoDictionaryForKeys(const platform::Array& keys, const LocalizedInfoCompletion& completion) const;

    /// Identifier, UUID and path, for logs.
    std::string description() const;

protected:
    /// What `initWithName` does to a new record; for initializers of subclasses.
    bool initializeWithName(const platform::Value& identifier, const std::optional<platform::URL>& url,
                            const platform::Value& bundleInfo, const platform::Value& info,
                            const std::optional<platform::UUID>& uuid);

private:
    // Texts of the identity and the locations are made once, when they are set: every form has them.
    struct Identity {
        std::optional<platform::UUID> uuid;
        platform::Value text;
    };
    struct Location {
        platform::Value path;
        platform::Value text; // of the URL; absent when that is the URL of the path, as for every bundle
    };
    using LocationField = AtomicField<Location>;
    static void setLocation(LocationField& field, const std::optional<platform::URL>& url);
    static std::optional<platform::URL> urlOf(const Location& location);
    static std::string pathOf(const Location& location);

    std::atomic<bool> _onSystemVolume = false;
    platform::Value _plugInDictionary;
    AtomicField<platform::Value> _identifier;
    AtomicField<platform::Value> _originalIdentifier;
    LocationField _url;
    LocationField _containingUrl;
    AtomicField<platform::Value> _bundleInfoDictionary;
    AtomicField<platform::Value> _entitlements;
    std::atomic<std::uint64_t> _hubProtocolVersion = 0;
    AtomicField<platform::Value> _localizedName;
    AtomicField<platform::Value> _localizedShortName;
    AtomicField<platform::Value> _localizedContainingName;
    AtomicField<platform::Value> _localizedFilevaneActionNames;
    AtomicField<platform::Value> _annotations;
    std::atomic<std::int64_t> _lastModified = 0;
    AtomicField<Identity> _identity;
    AtomicField<platform::Value> _cdhash;
    AtomicField<platform::Value> _requirement;
};

/// For unordered containers of pointers to records: by UUID.
struct ZBPlugInHash {
    template <class Pointer> std::size_t operator()(const Pointer& plugIn) const { return plugIn->hash(); }
};
struct ZBPlugInEqual {
    template <class Left, class Right> bool operator()(const Left& left, const Right& right) const {
        return left->isEqual(*right);
    }
};

} // namespace zembra
