#include "zbd/MatchRules.h"

namespace zbd {

using platform::Value;

namespace {

/// Shorter arrays of patterns are tried one by one.
constexpr std::size_t manyPatterns = 16;

} // namespace

std::shared_ptr<const MatchAlternatives> preparedAlternatives(const Value& pattern, platform::TypeConformance& types) {
    const auto patterns = pattern.array();
    if (!patterns || patterns->size() <= manyPatterns) return nullptr;
    return std::make_shared<const MatchAlternatives>(*patterns, types);
}

MatchRules::MatchRules(const std::optional<platform::Dictionary>& rules, platform::TypeConformance& types) {
    if (!rules) return;
    _rules.reserve(rules->size());
    for (const auto& rule : *rules) _rules.push_back({rule.key, rule.value, preparedAlternatives(rule.value, types)});
}

} // namespace zbd
