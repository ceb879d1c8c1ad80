#pragma once

#include "Zembra/AtomicField.h"
#include "Zembra/ZBPlugInCore.h"
#include "platform/Platform.h"
#include "platform/Registry.h"
#include "zbd/MatchRules.h"

#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>

namespace zbd {

class ZBDQmxClient;

/// The daemon's record of one plug-in, built from the registry's description of it. Its facts are fixed when it is
/// made; its manifest follows the registry. May be read from any queue.
class ZBDPlugIn final : public zembra::ZBPlugInCore {
public:
    /// Null for a proxy without location or identifier, and for a mis-configured plug-in, which is logged.
    static std::shared_ptr<ZBDPlugIn> initWithCXData(platform::Platform& platform,
                                                     const platform::PlugInProxyRef& proxy);

    /// A fresh proxy, by UUID or else by location; null when the registry knows neither.
    platform::PlugInProxyRef getProxy() const;

    /// The registry's current manifest of the bundle, asked for again whenever the registry's knowledge has changed;
    /// none when the plug-in has left the registry.
    std::optional<platform::Dictionary> bundleInfoDictionary() const override;
    platform::Value infoKey(std::string_view key) const override;
    platform::Value pluginKey(std::string_view key) const override;
    platform::Value attribute(std::string_view key) const override;

    /// Whether a cached record may still be handed out: records follow the registry, so always.
    bool isStillValid() const { return true; }

    /// `dictionary` without the entries that build tools leave in manifests.
    static platform::MutableDictionary prunedInfoDictionaryFor(const platform::Dictionary& dictionary);

    platform::Value originalIdentifier() const override { return _originalIdentifier; }
    std::optional<platform::Dictionary> entitlements() const override { return _entitlements; }
    std::optional<platform::URL> dataContainerURL() const override { return _dataContainerURL; }
    platform::Value localizedName() const override { return _localizedName.get(); }
    void setLocalizedName(platform::Value value) override { setLocalized(_localizedName, std::move(value)); }
    platform::Value localizedShortName() const override { return _localizedShortName.get(); }
    void setLocalizedShortName(platform::Value value) override { setLocalized(_localizedShortName, std::move(value)); }
    platform::Value localizedContainingName() const override { return _localizedContainingName.get(); }
    void setLocalizedContainingName(platform::Value value) override {
        setLocalized(_localizedContainingName, std::move(value));
    }
    /// A dictionary from creation on, empty when the plug-in declares no actions.
    std::optional<platform::Dictionary> localizedFilevaneActionNames() const override;
    void setLocalizedFilevaneActionNames(platform::Value value) override;

    /// The manifest as of the last refresh; absent when the plug-in had left the registry.
    platform::Value infoVlist() const { return _infoVlist.get(); }
    /// The registry's knowledge at the last refresh; none before the first look-up.
    std::optional<platform::UUID> cxKnowledgeUUID() const { return _cxKnowledgeUUID.get(); }

    // Facts that nothing here tells: never set.
    bool ageRestricted() const { return false; }
    platform::Value containerAgeRestriction() const { return {}; }
    platform::Value vNode() const { return {}; }

    /// The plug-in's own entitlement, or an absent value.
    platform::Value valueForEntitlement(std::string_view key) const;
    /// True for any value but the boolean false and the number 0.
    bool hasEntitlement(std::string_view key) const;
    /// Where the user's annotations of the plug-in are filed: under the identifier of the plug-in that it replaces, if
    /// it replaces one, else under its own.
    std::string annotationKey() const;

    platform::Failure diagnose() const override;

    /// A form of the caller's own, as `exportForm` makes it. What it is made of is kept, encoded, until the registry's
    /// knowledge changes, so that a plug-in that is asked for again and again costs little.
    platform::MutableDictionary currentForm(platform::Failure* error) const;

    // ZBDPlugInTokens.cpp

    /// Adds the sandbox tokens that a host needs to a form made by `exportForm`.
    void augmentForm(platform::MutableDictionary& form) const;
    /// A file-read token for each resource inside the bundle that the sandbox service grants, under the resource as
    /// written. `resources` is a string or an array; elements of another kind are skipped.
    platform::MutableDictionary issueResourceExtensions(const platform::Value& resources) const;

    // ZBDPlugInMatch.cpp. Not to be called on the database queue: elections are read there.

    /// Whether the plug-in fulfils every rule; it does when there are none.
    bool match(const std::optional<platform::Dictionary>& rules) const;
    /// The first rule that it does not fulfil.
    std::optional<RuleMismatch> mismatch(const MatchRules& rules) const;
    bool matchKey(std::string_view key, const platform::Value& pattern) const;
    /// `patterns` is a string or an array of strings, of which one has to fit; nothing fits anything else.
    bool matchValue(std::string_view value, const platform::Value& patterns) const;
    bool matchValue(std::string_view value, std::string_view pattern) const;
    bool matchDictionary(const platform::Value& value, const platform::Dictionary& pattern) const;

    // ZBDPlugInAuthorization.cpp

    /// Why the host may not use the plug-in; none when it may.
    std::optional<std::string> allowForClient(const ZBDQmxClient& host) const;
    /// The privacy services that the user granted to the containing application. Empty when that cannot be learnt.
    std::set<std::string> allowedPVCServices() const;

    // ZBDPlugInActivation.cpp

    /// Registers the plug-in's executable with the service manager for this host alone. `environment` is what the host
    /// wants the plug-in to receive; whether it may, and may use the plug-in at all, is the caller's to check.
    platform::Failure enableForClient(const ZBDQmxClient& host,
                                      const std::optional<platform::Dictionary>& environment) const;
    /// One busy instance of the plug-in, by its bundle identifier; none when no instance is busy.
    std::optional<platform::Dictionary> checkBusy() const;

private:
    explicit ZBDPlugIn(platform::Platform& platform) : _platform(platform) {}
    bool setupWithProxy(const platform::PlugInProxyRef& proxy);
    platform::Value currentInfo() const;
    platform::Value valueForRule(std::string_view key) const;
    std::string userElection() const;
    const char* sandboxProfile() const;
    bool accepts(const MatchRule& rule, const platform::Value& value) const;
    void setLocalized(zembra::AtomicField<platform::Value>& field, platform::Value value);

    platform::Platform& _platform;
    zembra::AtomicField<platform::Value> _localizedName;
    zembra::AtomicField<platform::Value> _localizedShortName;
    zembra::AtomicField<platform::Value> _localizedContainingName;
    zembra::AtomicField<platform::Value> _localizedFilevaneActionNames;
    std::optional<platform::Dictionary> _entitlements;
    platform::Value _originalIdentifier;
    std::optional<platform::URL> _dataContainerURL;

    mutable std::recursive_mutex _refreshLock; // one refresh at a time: fetching and storing are one step
    mutable zembra::AtomicField<platform::Value> _infoVlist;
    mutable zembra::AtomicField<std::optional<platform::UUID>> _cxKnowledgeUUID;

    struct KeptForm {
        platform::Dictionary manifest; // the one it was made from
        platform::MutableDictionary form;
    };
    mutable zembra::AtomicField<std::shared_ptr<const KeptForm>> _keptForm;

    struct Tokens {
        platform::Value extensions; // a dictionary, or absent
        platform::Value service;    // a string, or absent
        bool mayBeKept = false;
        std::optional<platform::UUID> knowledge; // of the registry, when they were issued
    };
    std::shared_ptr<const Tokens> issueTokens() const;
    mutable zembra::AtomicField<std::shared_ptr<const Tokens>> _keptTokens;
};

/// What the daemon adds to the registry's proxies.
namespace ZBDPluginAdditions {

/// Action name to localized title, for the actions that the plug-in dictionary declares.
platform::Dictionary localizedFilevaneActionNamesForZBDict(platform::Registry& registry,
                                                           const platform::PlugInProxy& proxy,
                                                           const platform::Dictionary& plugInDictionary);

} // namespace ZBDPluginAdditions

} // namespace zbd
