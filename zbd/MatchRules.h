#pragma once

#include "platform/PropertyList.h"
#include "zbd/MatchOperators.h"

#include <memory>
#include <optional>
#include <vector>

namespace zbd {

/// One entry of a rules dictionary. Key and pattern share their storage with it.
struct MatchRule {
    platform::Value key;
    platform::Value pattern;
    std::shared_ptr<const MatchAlternatives> alternatives; // of a long array of patterns; else null
};

/// The rule that a plug-in does not fulfil, and what it compared.
struct RuleMismatch {
    platform::Value key;
    platform::Value pattern;
    platform::Value value; // the plug-in's; absent when it has none
};

/// The pattern as one test, when it is an array so long that trying its elements one by one for each plug-in would
/// cost more.
std::shared_ptr<const MatchAlternatives> preparedAlternatives(const platform::Value& pattern,
                                                              platform::TypeConformance& types);

/// A rules dictionary made ready for many plug-ins, its entries in their order.
class MatchRules {
public:
    MatchRules(const std::optional<platform::Dictionary>& rules, platform::TypeConformance& types);

    std::vector<MatchRule>::const_iterator begin() const { return _rules.begin(); }
    std::vector<MatchRule>::const_iterator end() const { return _rules.end(); }

private:
    std::vector<MatchRule> _rules;
};

} // namespace zbd
