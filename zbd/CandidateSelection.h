#pragma once

#include "platform/PropertyList.h"
#include "zbd/RecentVerdicts.h"
#include "zbd/ZBDatabase.h"

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zbd {

class ZBDQmxClient;
class ZBDServer;

/// What one discovery asks of its candidates.
struct Selection {
    ZBDServer& server;
    const ZBDQmxClient& client;
    std::uint64_t flags = 0; // DiscoveryFlags
    const MatchRules& rules;
    std::vector<MatchRules> exclusions; // the user's, as read for this request
    bool isRestricted = true;           // whether the host may be entitled to a part of the plug-ins only
    bool hasHolds = true;               // whether a plug-in may be on hold
    RecentVerdicts::Verdicts verdicts;  // of the rules, on each candidate in its place; null when they are not known
};

/// One plug-in under test, and what it keeps, if anything.
struct Candidate {
    const ZBDPlugInRef& plugIn;
    const KeptFormRef& kept;
    std::size_t place = 0; // among the candidates
};

/// Why a candidate is dropped.
struct Rejection {
    std::string reason;                                  // for people
    std::optional<RuleMismatch> mismatch = std::nullopt; // when rules decided
};

/// One test that a candidate has to pass.
struct SelectionTest {
    std::string_view name;
    bool hostSide; // skipped by a host that asks for everything
    /// None when the candidate passes. Logs the lines that the log has for the case.
    std::optional<Rejection> (*reject)(const Selection& selection, const Candidate& candidate);
};

/// In the order in which they are made.
std::span<const SelectionTest> selectionTests();

/// The first test that drops the candidate, or none.
std::optional<Rejection> rejectionOf(const Selection& selection, const Candidate& candidate);

/// The dictionaries in the user's exclusions; whatever else is stored there is ignored.
std::vector<MatchRules> readExclusions(const platform::Value& stored);

} // namespace zbd
