#include "Zembra/ZBDaemonClient.h"
#include "Zembra/ZBLog.h"
#include "platform/Format.h"
#include "platform/TracePoints.h"
#include "zbd/CandidateSelection.h"
#include "zbd/SameIdentifierReduction.h"
#include "zbd/Transaction.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

#include <algorithm>
#include <ranges>
#include <unordered_map>

namespace zbd {

namespace log = zembra::log;
namespace key = zembra::key;
namespace code = zembra::code;
namespace formKey = zembra::formKey;
using platform::Array;
using platform::Dictionary;
using platform::MutableDictionary;
using platform::Value;

namespace {

constexpr std::size_t pathBufferSize = 1024; // a host at a longer path has no bundle-relative plug-ins

/// What is left of the longest message for "matches", with room for what stands around it in the reply.
constexpr std::size_t maximumMatchesSize = platform::maximumMessageSize - 1024;
/// More may be gathered on the way, for newer versions replace older ones; but not any amount.
constexpr std::size_t maximumGatheredSize = 4 * maximumMatchesSize;
constexpr std::string_view tooLong = "the matching plug-ins are too many for one reply";

using Candidates = std::vector<ZBDPlugInRef>;
/// Replaced identifier to the form that replaces it; the form is shared with the answer.
using Overrides = std::unordered_map<std::string, MutableDictionary>;

std::string_view textOf(const Value& value) { return value.string().value_or(""); }

/// A candidate as the log shows it.
struct Listing {
    explicit Listing(const ZBDPlugInRef& candidate) : kept(candidate->keptForm()) {
        if (!kept) made = candidate->listing();
    }
    operator std::string_view() const { return kept ? kept->listing : made; } // NOLINT(google-explicit-constructor)

    KeptFormRef kept;
    std::string made;
};

// Both lists are made as they are printed: the log shows the first few dozen of thousands.

void logCandidates(const Candidates& candidates) {
    if (candidates.empty()) {
        log::ops().info("Candidate plugin count: 0");
    } else {
        log::ops().info("Candidate plugin count: %u, info: %{public}@", candidates.size(),
                        std::views::transform(candidates, [](const auto& candidate) { return Listing(candidate); }));
    }
}

void logResults(const std::vector<AnswerForm>& forms) {
    if (forms.empty()) {
        log::ops().info("Resulting plugin count: 0");
    } else {
        const auto uuid = [](const AnswerForm& answer) { return answer.form()[formKey::uuid]; };
        log::ops().info("Resulting plugin count: %u, UUIDs: %{public}@", forms.size(),
                        std::views::transform(forms, uuid));
    }
}

/// A host that carries a plug-in itself does not see other copies of it.
ZBDPlugIns preferBundleRelative(const ZBDPlugIns& candidates, std::string_view hostPath) {
    std::unordered_map<std::string, ZBDPlugInRef> preferred;
    for (const auto& candidate : *candidates) {
        if (!candidate->beginsWithContainingPath(hostPath)) continue;
        preferred[std::string(textOf(candidate->identifier()))] = candidate;
    }
    if (preferred.empty()) return candidates;
    Candidates left;
    for (const auto& candidate : *candidates) {
        const auto found = preferred.find(std::string(textOf(candidate->identifier())));
        if (found == preferred.end() || found->second == candidate) {
            left.push_back(candidate);
            continue;
        }
        log::ops().info("Ignoring %{public}@ @ '%{public}@' in favor of bundle-relative '%{public}@'",
                        found->second->uuid(), candidate->path(), found->second->path());
    }
    return std::make_shared<const Candidates>(std::move(left));
}

/// The version as the form states it.
std::optional<std::string_view> versionOf(const ZBDPlugIn& plugIn, const MutableDictionary& form) {
    const auto stated = form.string(formKey::version);
    // A manifest may say what forms say where it says nothing.
    if (stated == SameIdentifierReduction::noVersion && plugIn.version().string() != stated) return std::nullopt;
    return stated;
}

ReductionFacts factsOf(const ZBDPlugIn& plugIn, const MutableDictionary& form) {
    // A record never changes its identifier.
    return {textOf(plugIn.identifier()), versionOf(plugIn, form), plugIn.onSystemVolume(), plugIn.lastModified()};
}

void noteOverrides(const ZBDPlugIn& plugIn, const MutableDictionary& form, Overrides& overrides) {
    const Value replaced = plugIn.valueForEntitlement(zembra::entitlement::replacePlugIn);
    if (const auto identifier = replaced.string()) {
        overrides.insert_or_assign(std::string(*identifier), form);
        return;
    }
    const auto identifiers = replaced.array();
    if (!identifiers) return;
    for (const Value& element : *identifiers) {
        if (const auto identifier = element.string()) overrides.insert_or_assign(std::string(*identifier), form);
    }
}

void markOverrides(std::vector<AnswerForm>& forms, Overrides& overrides) {
    if (overrides.empty()) return;
    for (auto& replaced : forms) {
        const auto found = overrides.find(std::string(textOf(replaced.form()[formKey::identifier])));
        if (found == overrides.end()) continue;
        MutableDictionary& form = replaced.ownForm();
        MutableDictionary& replacing = found->second;
        form.set(formKey::overrider, replacing[formKey::uuid]);
        replacing.set(formKey::overriding, form[formKey::identifier]);
        log::ops().info("plug-in %{public}@ overrides %{public}@", replacing[formKey::uuid], form[formKey::uuid]);
    }
}

} // namespace

void Transaction::matchPlugIns() {
    std::optional<Dictionary> rules;
    if (const Value value = _request[key::rules]) {
        rules = value.dictionary();
        if (!rules) return fail(code::malformed, "invalid request format (bad rules dictionary)");
    }
    const std::uint64_t flags = _request.uint64(key::flags).value_or(0);
    if ((flags & zembra::ZBDiscoverAll) != 0 && (!_client->hasEntitlement(zembra::entitlement::manager) ||
                                                 server()->platform().sandbox.isSandboxed(_client->pid()))) {
        return fail(code::notPermitted, "unauthorized discovery flag (ZBDiscoverAll)");
    }

    const MatchRules prepared(rules);
    auto exclusions = readExclusions(server()->userPrefs().exclusions());
    ZBDPlugIns candidates = server()->findPlugIns(rules);
    if (!candidates) candidates = std::make_shared<const Candidates>();
    platform::trace::discoverRaw(static_cast<unsigned>(candidates->size()));
    logCandidates(*candidates);
    candidates = preferBundleRelativeForHost(candidates);
    const bool isHostAsked = (flags & zembra::ZBDiscoverAll) == 0 && !candidates->empty();
    const auto knowledge = server()->platform().registry.knowledgeUUID();
    const Selection selection{
        .server = *server(),
        .client = *_client,
        .flags = flags,
        .rules = prepared,
        .exclusions = std::move(exclusions),
        .isRestricted = isHostAsked && _client->entitlementValueForKey(zembra::entitlement::allowedPlugIns),
        .hasHolds = isHostAsked && server()->hasHolds(),
        .verdicts = rules ? server()->recentVerdicts().verdictsOn(candidates, *rules, prepared, knowledge) : nullptr,
    };

    // An older protocol has no forms in its reply, so none are too many.
    const auto fits = [&](std::size_t size, std::size_t limit = maximumMatchesSize) {
        return size <= limit || _version != static_cast<std::uint64_t>(zembra::currentVersion);
    };
    const auto now = std::chrono::steady_clock::now();
    SameIdentifierReduction results(flags);
    Overrides overrides;
    for (std::size_t place = 0; place < candidates->size(); ++place) {
        const ZBDPlugInRef& candidate = (*candidates)[place];
        const auto kept = candidate->keptForm();
        if (rejectionOf(selection, {candidate, kept, place})) continue;
        if (kept && !kept->replacesOthers && isComplete(*candidate, *kept, now)) {
            if (!results.admit(kept->facts)) continue;
            results.add(kept->facts, AnswerForm::shared(kept->form));
        } else {
            platform::Failure error;
            MutableDictionary form = candidate->currentForm(&error, kept);
            if (error) {
                log::ops().error("failed to export matching plug-in %{public}@: %{public}@", candidate->uuid(), *error);
            }
            const auto facts = factsOf(*candidate, form);
            if (!results.admit(facts)) continue;
            completeForm(*candidate, form, kept, now);
            noteOverrides(*candidate, form, overrides);
            results.add(facts, std::move(form));
        }
        if (!fits(results.encodedSize(), maximumGatheredSize)) return fail(code::malformed, tooLong);
    }
    if (!fits(results.encodedSize())) return fail(code::malformed, tooLong);
    auto forms = results.takeForms();
    markOverrides(forms, overrides);
    logResults(forms);
    const Value answer = Array::of(std::views::transform(forms, &AnswerForm::form));
    if (!overrides.empty() && !fits(platform::compactSize(answer))) return fail(code::malformed, tooLong);
    if (const auto matches = zembra::ZBDaemonClient::convertToQMX(answer, _version)) {
        reply().set(key::matches, *matches);
    }
    log::ops().debug("reply marshalled");
    done();
}

ZBDPlugIns Transaction::preferBundleRelativeForHost(const ZBDPlugIns& candidates) {
    const auto peer = connection();
    if (!peer) return candidates;
    const auto hostPath = server()->platform().processes.executablePath(peer->peerAuditToken(), pathBufferSize);
    if (hostPath) return preferBundleRelative(candidates, *hostPath);
    log::ops().error("Failed to determine path for pid %d, %{errno}d", peer->peerPid(), hostPath.error().code);
    return candidates;
}

} // namespace zbd
