#include "zbd/MatchRules.h"

#include <utility>

namespace zbd {

using platform::Value;

namespace {

/// Shorter arrays of patterns are tried one by one.
constexpr std::size_t manyPatterns = 16;

} // namespace

MatchRule::MatchRule(Value key, Value pattern) : _key(std::move(key)), _pattern(std::move(pattern)) {
    const auto patterns = _pattern.array();
    _isLong = patterns && patterns->size() > manyPatterns;
}

const MatchAlternatives* MatchRule::alternatives(platform::TypeConformance& types) const {
    if (_isLong && !_alternatives) _alternatives = std::make_shared<const MatchAlternatives>(*_pattern.array(), types);
    return _alternatives.get();
}

MatchRules::MatchRules(const std::optional<platform::Dictionary>& rules) {
    if (!rules) return;
    _rules.reserve(rules->size());
    for (const auto& [key, pattern] : *rules) _rules.emplace_back(key, pattern);
}

} // namespace zbd
