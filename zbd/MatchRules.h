#pragma once

#include "platform/PropertyList.h"
#include "zbd/MatchOperators.h"

#include <memory>
#include <optional>
#include <vector>

namespace zbd {

/// One entry of a rules dictionary. Key and pattern share their storage with it. For one thread at a time.
class MatchRule {
public:
    MatchRule(platform::Value key, platform::Value pattern);

    const platform::Value& key() const { return _key; }
    const platform::Value& pattern() const { return _pattern; }
    /// The pattern as one test, when it is an array so long that trying its elements one by one for each plug-in would
    /// cost more; else null. Made when the first value is to be compared with it.
    const MatchAlternatives* alternatives(platform::TypeConformance& types) const;

private:
    platform::Value _key;
    platform::Value _pattern;
    bool _isLong;
    mutable std::shared_ptr<const MatchAlternatives> _alternatives;
};

/// The rule that a plug-in does not fulfil, and what it compared.
struct RuleMismatch {
    platform::Value key;
    platform::Value pattern;
    platform::Value value; // the plug-in's; absent when it has none
};

/// A rules dictionary made ready for many plug-ins, its entries in their order.
class MatchRules {
public:
    explicit MatchRules(const std::optional<platform::Dictionary>& rules);

    std::vector<MatchRule>::const_iterator begin() const { return _rules.begin(); }
    std::vector<MatchRule>::const_iterator end() const { return _rules.end(); }

private:
    std::vector<MatchRule> _rules;
};

} // namespace zbd
