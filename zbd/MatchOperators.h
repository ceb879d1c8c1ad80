#pragma once

#include "platform/PropertyList.h"
#include "platform/TypeConformance.h"

#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_set>

namespace zbd {

/// What a pattern's leading operator can ask for.
enum class MatchTest { conforms, is, unrecognized, unequal, notAfter, notBefore, equal, before, after };

/// A pattern taken apart.
struct MatchComparison {
    MatchTest test;
    std::string_view operand; // part of the pattern
};

/// The first operator that the pattern begins with; "equal" to the whole pattern when there is none.
MatchComparison matchComparison(std::string_view pattern);

/// Whether the value is what the comparison asks for. An unrecognized operator asks for nothing that is.
bool evaluate(const MatchComparison& comparison, std::string_view value, platform::TypeConformance& types);

/// The strings of an array of patterns as one test: a value is looked up among them instead of being compared with
/// each, so that many values against many patterns cost their sum and not their product. Unrecognized operators are
/// logged once, when it is made.
class MatchAlternatives {
public:
    MatchAlternatives(const platform::Array& patterns, platform::TypeConformance& types);
    bool accepts(std::string_view value) const;

private:
    /// An operand together with whether it is itself within the bound.
    struct Bound {
        std::string operand;
        bool isInclusive;
    };
    static void widen(std::optional<Bound>& bound, std::string_view operand, bool isInclusive, bool isUpper);

    platform::TypeConformance& _types;
    std::unordered_set<std::string> _equal; // in comparable form
    std::set<std::string> _unequal;         // in comparable form; two different ones refuse no value
    std::optional<Bound> _upper;
    std::optional<Bound> _lower;
    std::unordered_set<std::string> _conforms;
    std::unordered_set<std::string> _is; // the operands and all their supertypes
};

} // namespace zbd
