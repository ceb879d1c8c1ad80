#include "zbd/CandidateSelection.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBProtocol.h"
#include "zbd/ZBDQmxClient.h"
#include "zbd/ZBDServer.h"

#include <array>

namespace zbd {

namespace log = zembra::log;

namespace {

using Outcome = std::optional<Rejection>;

Outcome mustHaveContainer(const Selection&, const Candidate& candidate) {
    if (candidate.kept && candidate.kept->isContained) return std::nullopt;
    if (candidate.plugIn->onSystemVolume() || candidate.plugIn->isContained()) return std::nullopt;
    return Rejection{"neither on the system volume nor in an application"};
}

Outcome mustBeOnSystemVolumeWhenAsked(const Selection& selection, const Candidate& candidate) {
    if ((selection.flags & zembra::ZBDiscoverSystemOnly) == 0 || candidate.plugIn->onSystemVolume()) {
        return std::nullopt;
    }
    return Rejection{"the host asked for plug-ins on the system volume only"};
}

Outcome mustBeTheHostsOwnWhenDedicated(const Selection& selection, const Candidate& candidate) {
    if (!(candidate.kept ? candidate.kept->isDedicated : candidate.plugIn->isDedicated())) return std::nullopt;
    const auto& bundle = selection.client.bundle();
    const auto directory = bundle ? bundle->plugInsPath() : std::nullopt;
    if (directory && candidate.plugIn->path().starts_with(*directory)) return std::nullopt;
    return Rejection{"dedicated to another host"};
}

Outcome mustNotBeHeld(const Selection& selection, const Candidate& candidate) {
    if (!selection.hasHolds || !selection.server.holdOnPlugIn(candidate.plugIn)) return std::nullopt;
    return Rejection{"on hold"};
}

Outcome mustMatchRules(const Selection& selection, const Candidate& candidate) {
    if (selection.verdicts && (*selection.verdicts)[candidate.place]) return std::nullopt;
    auto mismatch = candidate.plugIn->mismatch(selection.rules);
    if (!mismatch) return std::nullopt;
    return Rejection{"does not match the host's rules", std::move(mismatch)};
}

Outcome mustNotBeExcluded(const Selection& selection, const Candidate& candidate) {
    for (const MatchRules& exclusion : selection.exclusions) {
        if (candidate.plugIn->mismatch(exclusion)) continue;
        log::ops().info("client %d plugin %{public}@ globally excluded", selection.client.pid(),
                        candidate.plugIn->uuid());
        return Rejection{"excluded by the user"};
    }
    return std::nullopt;
}

Outcome mustBeAllowed(const Selection& selection, const Candidate& candidate) {
    const bool isConditional =
        candidate.kept ? candidate.kept->requiresEntitlement : candidate.plugIn->requiresEntitlement();
    if (!selection.isRestricted && !isConditional) return std::nullopt;
    auto reason = candidate.plugIn->allowForClient(selection.client);
    if (!reason) return std::nullopt;
    log::ops().info("client %d cannot use plugin %{public}@: %{public}@", selection.client.pid(),
                    candidate.plugIn->uuid(), *reason);
    return Rejection{std::move(*reason)};
}

constexpr std::array tests{
    SelectionTest{"container", true, mustHaveContainer},
    SelectionTest{"system volume", true, mustBeOnSystemVolumeWhenAsked},
    SelectionTest{"dedicated", true, mustBeTheHostsOwnWhenDedicated},
    SelectionTest{"hold", true, mustNotBeHeld},
    SelectionTest{"rules", false, mustMatchRules},
    SelectionTest{"exclusions", false, mustNotBeExcluded},
    SelectionTest{"authorization", true, mustBeAllowed},
};

} // namespace

std::span<const SelectionTest> selectionTests() { return tests; }

std::optional<Rejection> rejectionOf(const Selection& selection, const Candidate& candidate) {
    const bool everything = (selection.flags & zembra::ZBDiscoverAll) != 0;
    for (const SelectionTest& test : tests) {
        if (everything && test.hostSide) continue;
        if (auto rejection = test.reject(selection, candidate)) return rejection;
    }
    return std::nullopt;
}

std::vector<MatchRules> readExclusions(const platform::Value& stored) {
    std::vector<MatchRules> exclusions;
    for (const platform::Value& element : stored.array().value_or(platform::Array())) {
        if (const auto rules = element.dictionary()) exclusions.emplace_back(rules);
    }
    return exclusions;
}

} // namespace zbd
