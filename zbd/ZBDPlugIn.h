#pragma once

#include "Zembra/AtomicField.h"
#include "Zembra/ZBPlugInCore.h"
#include "platform/Platform.h"
#include "platform/Registry.h"
#include "zbd/KeptForm.h"
#include "zbd/MatchRules.h"
#include "zbd/RecentForms.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zbd {

class ZBDQmxClient;

/// The daemon's record of one plug-in, built from the registry's description of it. Its facts are fixed when it is
/// made; its manifest follows the registry. May be read from any queue.
class ZBDPlugIn final : public zembra::ZBPlugInCore, public std::enable_shared_from_this<ZBDPlugIn> {
public:
    /// Null for a proxy without location or identifier, and for a mis-configured plug-in, which is logged.
    /// `recentForms` is shared by all records of a daemon.
    static std::shared_ptr<ZBDPlugIn>
    initWithCXData(platform::Platform& platform, const platform::PlugInProxyRef& proxy,
                   std::shared_ptr<RecentForms> recentForms = std::make_shared<RecentForms>());

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

    std::optional<platform::URL> dataContainerURL() const override {
        return _dataContainerURL ? std::optional(*_dataContainerURL) : std::nullopt;
    }
    void setLocalizedName(platform::Value value) override;
    void setLocalizedShortName(platform::Value value) override;
    void setLocalizedContainingName(platform::Value value) override;
    /// A dictionary from creation on, empty when the plug-in declares no actions.
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

    /// Only for a plug-in that is asked for again and again; else null, also when what was kept is outdated.
    KeptFormRef keptForm() const;
    /// Gives its memory back.
    void forgetForm() const { _keptForm.set(nullptr); }
    /// Whether a form of that kept one has the annotations and tokens that it would get now.
    bool isComplete(const KeptForm& kept, const FormCompletion& now) const;
    /// Whether hosts need an entitlement that the manifest names.
    bool requiresEntitlement() const;

    /// A form of the caller's own, as `exportForm` makes it; one that extends the kept form where there is one, which
    /// costs little. That one has the annotations and tokens of the last answer, so the caller is to set both unless
    /// it `isComplete`: where they are the same nothing changes. `kept` is what `keptForm` has just answered.
    platform::MutableDictionary currentForm(platform::Failure* error, const KeptFormRef& kept) const;
    platform::MutableDictionary currentForm(platform::Failure* error) const { return currentForm(error, keptForm()); }

    /// Identifier, version and UUID, as lists in the log show them.
    std::string listing() const;

    // ZBDPlugInTokens.cpp

    /// Issues the sandbox tokens that a host needs and sets them in a form made by `currentForm` or `exportForm`, whose
    /// annotations are set: those of `completion`. What differs from the kept form then takes its place.
    void augmentForm(platform::MutableDictionary& form, const KeptFormRef& kept,
                     const FormCompletion& completion) const;
    void augmentForm(platform::MutableDictionary& form) const { augmentForm(form, keptForm(), {}); }
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
    ZBDPlugIn(platform::Platform& platform, std::shared_ptr<RecentForms> recentForms)
        : _platform(platform), _recentForms(std::move(recentForms)) {}
    bool setupWithProxy(const platform::PlugInProxyRef& proxy);
    void refreshInfo() const;
    platform::Value currentInfo() const;
    /// Where rules look last, once a rule has looked there.
    struct RuleFacts {
        platform::Dictionary info;
        platform::Dictionary attributes;
    };
    platform::Value valueForRule(std::string_view key, std::optional<RuleFacts>& facts) const;
    std::string userElection() const;
    const char* sandboxProfile() const;
    bool accepts(const MatchRule& rule, const platform::Value& value) const;

    platform::Platform& _platform;
    std::shared_ptr<const platform::URL> _dataContainerURL; // in the proxy, which the registry keeps too

    mutable std::recursive_mutex _refreshLock; // one refresh at a time: fetching and storing are one step
    // Together, for answers of a thousand plug-ins look at all three of each.
    mutable zembra::AtomicField<platform::Value> _infoVlist;
    mutable zembra::AtomicField<std::optional<platform::UUID>> _cxKnowledgeUUID;
    mutable zembra::AtomicField<KeptFormRef> _keptForm; // `_recentForms` has it forgotten again

    TokenNeeds tokenNeeds() const;
    struct IssuedToken {
        platform::Value resource;
        std::string text;
    };
    struct IssuedTokens {
        std::vector<IssuedToken> granted;
        bool areAll = true;
    };
    IssuedTokens issueResourceTokens(const platform::Value& resources) const;
    static platform::MutableDictionary dictionaryOf(const std::vector<IssuedToken>& tokens);
    static bool shows(const std::optional<platform::Dictionary>& dictionary, const std::vector<IssuedToken>& tokens);
    bool augmentWithService(platform::MutableDictionary& form, const platform::Value& bundleIdentifier) const;
    void keepForm(KeptForm kept) const;

    const std::shared_ptr<RecentForms> _recentForms;
    mutable std::atomic<std::uint64_t> _lastMade = 0; // the number of the last form that had to be made
};

/// What the daemon adds to the registry's proxies.
namespace ZBDPluginAdditions {

/// Action name to localized title, for the actions that the plug-in dictionary declares.
platform::Dictionary localizedFilevaneActionNamesForZBDict(platform::Registry& registry,
                                                           const platform::PlugInProxy& proxy,
                                                           const platform::Dictionary& plugInDictionary);

} // namespace ZBDPluginAdditions

} // namespace zbd
