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

using Candidates = std::vector<ZBDPlugInRef>;
/// Replaced identifier to the form that replaces it; the form is shared with the answer.
using Overrides = std::unordered_map<std::string, MutableDictionary>;

std::string_view textOf(const Value& value) { return value.string().value_or(""); }

/// The database's set as a list in the order of the UUIDs, so that the same question gets the same answer.
Candidates sortedByUUID(const std::optional<ZBDPlugInSet>& plugIns) {
    Candidates candidates;
    if (plugIns) candidates.assign(plugIns->begin(), plugIns->end());
    std::sort(candidates.begin(), candidates.end(),
              [](const auto& left, const auto& right) { return *left->uuid() < *right->uuid(); });
    return candidates;
}

void logCandidates(const Candidates& candidates) {
    if (candidates.empty()) {
        log::ops().info("Candidate plugin count: 0");
    } else if (log::ops().isEnabled(platform::LogLevel::info)) {
        std::vector<std::string> texts;
        texts.reserve(candidates.size());
        for (const auto& candidate : candidates) {
            texts.push_back(
                platform::format("%@(%@) %@", candidate->identifier(), candidate->version(), candidate->uuid()));
        }
        log::ops().info("Candidate plugin count: %u, info: %{public}@", candidates.size(), texts);
    }
}

void logResults(const std::vector<MutableDictionary>& forms) {
    if (forms.empty()) {
        log::ops().info("Resulting plugin count: 0");
    } else if (log::ops().isEnabled(platform::LogLevel::info)) {
        std::vector<Value> uuids;
        uuids.reserve(forms.size());
        for (const auto& form : forms) uuids.push_back(form[formKey::uuid]);
        log::ops().info("Resulting plugin count: %u, UUIDs: %{public}@", forms.size(), uuids);
    }
}

/// A host that carries a plug-in itself does not see other copies of it.
void preferBundleRelative(Candidates& candidates, std::string_view hostPath) {
    std::unordered_map<std::string, ZBDPlugInRef> preferred;
    for (const auto& candidate : candidates) {
        const Value container = candidate->containingPath();
        if (!container || !hostPath.starts_with(textOf(container))) continue;
        preferred[std::string(textOf(candidate->identifier()))] = candidate;
    }
    if (preferred.empty()) return;
    std::erase_if(candidates, [&](const ZBDPlugInRef& candidate) {
        const auto found = preferred.find(std::string(textOf(candidate->identifier())));
        if (found == preferred.end() || found->second == candidate) return false;
        log::ops().info("Ignoring %{public}@ @ '%{public}@' in favor of bundle-relative '%{public}@'",
                        found->second->uuid(), candidate->path(), found->second->path());
        return true;
    });
}

void noteOverrides(const ZBDPlugIn& plugIn, const MutableDictionary& form, Overrides& overrides) {
    const Value replaced = plugIn.valueForEntitlement(zembra::entitlement::replacePlugIn);
    if (const auto identifier = replaced.string()) {
        overrides.insert_or_assign(std::string(*identifier), form);
        return;
    }
    for (const Value& element : replaced.array().value_or(Array())) {
        if (const auto identifier = element.string()) overrides.insert_or_assign(std::string(*identifier), form);
    }
}

void markOverrides(std::vector<MutableDictionary>& forms, Overrides& overrides) {
    if (overrides.empty()) return;
    for (auto& form : forms) {
        const auto found = overrides.find(std::string(textOf(form[formKey::identifier])));
        if (found == overrides.end()) continue;
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

    platform::TypeConformance& types = server()->platform().typeConformance;
    const Selection selection{*server(), *_client, flags, MatchRules(rules, types),
                              readExclusions(server()->userPrefs().exclusions(), types)};
    Candidates candidates = sortedByUUID(server()->findPlugIns(rules));
    platform::trace::discoverRaw(static_cast<unsigned>(candidates.size()));
    logCandidates(candidates);
    preferBundleRelativeForHost(candidates);

    SameIdentifierReduction results(flags);
    Overrides overrides;
    for (const auto& candidate : candidates) {
        if (!_client->acceptWork()) return; // nobody is left to answer
        if (rejectionOf(selection, candidate)) continue;
        platform::Failure error;
        MutableDictionary form = candidate->currentForm(&error);
        if (error) {
            log::ops().error("failed to export matching plug-in %{public}@: %{public}@", candidate->uuid(), *error);
        }
        const Value version = candidate->version();
        const SameIdentifierReduction::Facts facts{std::string(textOf(candidate->identifier())),
                                                   version.string() ? std::optional<std::string>(*version.string())
                                                                    : std::nullopt,
                                                   candidate->onSystemVolume(), candidate->lastModified()};
        if (!results.admit(facts)) continue;
        addAnnotationForPlugIn(*candidate, form);
        candidate->augmentForm(form);
        results.add(facts, form);
        noteOverrides(*candidate, form, overrides);
    }
    auto forms = results.takeForms();
    markOverrides(forms, overrides);
    logResults(forms);
    if (const auto matches = zembra::ZBDaemonClient::convertToQMX(Array::of(forms), _version)) {
        reply().set(key::matches, *matches);
    }
    log::ops().debug("reply marshalled");
    done();
}

void Transaction::preferBundleRelativeForHost(std::vector<ZBDPlugInRef>& candidates) {
    const auto peer = connection();
    if (!peer) return;
    const auto hostPath = server()->platform().processes.executablePath(peer->peerAuditToken(), pathBufferSize);
    if (!hostPath) {
        log::ops().error("Failed to determine path for pid %d, %{errno}d", peer->peerPid(), hostPath.error().code);
        return;
    }
    preferBundleRelative(candidates, *hostPath);
}

} // namespace zbd
