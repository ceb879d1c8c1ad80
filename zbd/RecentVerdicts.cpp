#include "zbd/RecentVerdicts.h"

#include "Zembra/ZBProtocol.h"

#include <algorithm>

namespace zbd {

using platform::Dictionary;
using platform::UUID;
using platform::Value;

namespace {

constexpr std::size_t maximumEntries = 16;
constexpr std::size_t maximumRules = 4096; // bytes; hosts choose them

/// One that compares: types conform as another service says, and of unknown operators the log tells for each plug-in.
bool isPlainPattern(const Value& pattern) {
    const auto text = pattern.string();
    return text && !text->starts_with('?');
}

/// Whether the same manifest always gives the same verdict, and nothing is logged on the way.
bool isJudgedByManifest(const MatchRule& rule) {
    if (rule.key() == Value(zembra::ruleKey::userElection)) return false;
    if (rule.pattern().boolean()) return true;
    const auto patterns = rule.pattern().array();
    return patterns ? std::ranges::all_of(*patterns, isPlainPattern) : isPlainPattern(rule.pattern());
}

} // namespace

RecentVerdicts::Verdicts RecentVerdicts::verdictsOn(const ZBDPlugIns& candidates, const Dictionary& rules,
                                                    const MatchRules& prepared, const std::optional<UUID>& knowledge) {
    // A list that nobody else has is made for this request alone.
    if (!knowledge || candidates.use_count() == 1) return nullptr;
    const auto known = std::ranges::find_if(_entries, [&](const Entry& entry) {
        return entry.knowledge == *knowledge && entry.candidates.lock() == candidates && entry.rules == rules;
    });
    if (known != _entries.end()) {
        _entries.splice(_entries.begin(), _entries, known);
        return known->verdicts;
    }
    if (!std::ranges::all_of(prepared, isJudgedByManifest) || platform::compactSize(rules) > maximumRules)
        return nullptr;
    auto verdicts = std::make_shared<std::vector<bool>>();
    for (const ZBDPlugInRef& candidate : *candidates) verdicts->push_back(!candidate->mismatch(prepared));
    _entries.push_front({rules, candidates, *knowledge, std::move(verdicts)});
    if (_entries.size() > maximumEntries) _entries.pop_back();
    return _entries.front().verdicts;
}

} // namespace zbd
