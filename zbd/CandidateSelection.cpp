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

Outcome mustHaveContainer(const Selection&, const ZBDPlugInRef& candidate) {
    if (candidate->onSystemVolume() || candidate->containingUrl()) return std::nullopt;
    return Rejection{"neither on the system volume nor in an application"};
}

Outcome mustBeOnSystemVolumeWhenAsked(const Selection& selection, const ZBDPlugInRef& candidate) {
    if ((selection.flags & zembra::ZBDiscoverSystemOnly) == 0 || candidate->onSystemVolume()) return std::nullopt;
    return Rejection{"the host asked for plug-ins on the system volume only"};
}

Outcome mustBeTheHostsOwnWhenDedicated(const Selection& selection, const ZBDPlugInRef& candidate) {
    if (!candidate->isDedicated()) return std::nullopt;
    const auto& bundle = selection.client.bundle();
    const auto directory = bundle ? bundle->plugInsPath() : std::nullopt;
    if (directory && candidate->path().starts_with(*directory)) return std::nullopt;
    return Rejection{"dedicated to another host"};
}

Outcome mustNotBeHeld(const Selection& selection, const ZBDPlugInRef& candidate) {
    if (!selection.server.holdOnPlugIn(candidate)) return std::nullopt;
    return Rejection{"on hold"};
}

Outcome mustMatchRules(const Selection& selection, const ZBDPlugInRef& candidate) {
    auto mismatch = candidate->mismatch(selection.rules);
    if (!mismatch) return std::nullopt;
    return Rejection{"does not match the host's rules", std::move(mismatch)};
}

Outcome mustNotBeExcluded(const Selection& selection, const ZBDPlugInRef& candidate) {
    for (const MatchRules& exclusion : selection.exclusions) {
        if (candidate->mismatch(exclusion)) continue;
        log::ops().info("client %d plugin %{public}@ globally excluded", selection.client.pid(), candidate->uuid());
        return Rejection{"excluded by the user"};
    }
    return std::nullopt;
}

Outcome mustBeAllowed(const Selection& selection, const ZBDPlugInRef& candidate) {
    auto reason = candidate->allowForClient(selection.client);
    if (!reason) return std::nullopt;
    log::ops().info("client %d cannot use plugin %{public}@: %{public}@", selection.client.pid(), candidate->uuid(),
                    *reason);
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

std::optional<Rejection> rejectionOf(const Selection& selection, const ZBDPlugInRef& candidate) {
    const bool everything = (selection.flags & zembra::ZBDiscoverAll) != 0;
    for (const SelectionTest& test : tests) {
        if (everything && test.hostSide) continue;
        if (auto rejection = test.reject(selection, candidate)) return rejection;
    }
    return std::nullopt;
}

std::vector<MatchRules> readExclusions(const platform::Value& stored, platform::TypeConformance& types) {
    std::vector<MatchRules> exclusions;
    for (const platform::Value& element : stored.array().value_or(platform::Array())) {
        if (const auto rules = element.dictionary()) exclusions.emplace_back(rules, types);
    }
    return exclusions;
}

} // namespace zbd
