#include "zbd/MatchOperators.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBUtilities.h"

#include <algorithm>
#include <array>

namespace zbd {

namespace log = zembra::log;
using zembra::comparableVersion;
using zembra::compareVersionString;

namespace {

struct Operator {
    std::string_view prefix;
    MatchTest test;
};

/// In the order in which they are tried: the first prefix that fits decides.
constexpr std::array operators{
    Operator{"?KT-CONFORMS:", MatchTest::conforms},
    Operator{"?KT-IS:", MatchTest::is},
    Operator{"?", MatchTest::unrecognized},
    Operator{"<>", MatchTest::unequal},
    Operator{"<=", MatchTest::notAfter},
    Operator{">=", MatchTest::notBefore},
    Operator{"=", MatchTest::equal},
    Operator{"<", MatchTest::before},
    Operator{">", MatchTest::after},
    Operator{"", MatchTest::equal},
};

} // namespace

MatchComparison matchComparison(std::string_view pattern) {
    const auto found = std::find_if(operators.begin(), operators.end(),
                                    [&](const Operator& candidate) { return pattern.starts_with(candidate.prefix); });
    return {found->test, pattern.substr(found->prefix.size())};
}

bool evaluate(const MatchComparison& comparison, std::string_view value, platform::TypeConformance& types) {
    const std::string_view operand = comparison.operand;
    switch (comparison.test) {
    case MatchTest::conforms: return types.conforms(value, operand);
    case MatchTest::is: return types.conforms(operand, value);
    case MatchTest::unrecognized: return false;
    case MatchTest::unequal: return compareVersionString(value, operand) != 0;
    case MatchTest::notAfter: return compareVersionString(value, operand) <= 0;
    case MatchTest::notBefore: return compareVersionString(value, operand) >= 0;
    case MatchTest::equal: return compareVersionString(value, operand) == 0;
    case MatchTest::before: return compareVersionString(value, operand) < 0;
    case MatchTest::after: return compareVersionString(value, operand) > 0;
    }
    return false;
}

MatchAlternatives::MatchAlternatives(const platform::Array& patterns, platform::TypeConformance& types)
    : _types(types) {
    for (const platform::Value& element : patterns) {
        const auto pattern = element.string();
        if (!pattern) continue;
        const auto [test, operand] = matchComparison(*pattern);
        switch (test) {
        case MatchTest::conforms: _conforms.emplace(operand); break;
        case MatchTest::is:
            for (std::string& type : types.supertypes(operand)) _is.insert(std::move(type));
            break;
        case MatchTest::unrecognized: log::ops().info("unrecognized match operator:%@", *pattern); break;
        case MatchTest::unequal:
            if (_unequal.size() < 2) _unequal.insert(comparableVersion(operand));
            break;
        case MatchTest::notAfter: widen(_upper, operand, true, true); break;
        case MatchTest::notBefore: widen(_lower, operand, true, false); break;
        case MatchTest::equal: _equal.insert(comparableVersion(operand)); break;
        case MatchTest::before: widen(_upper, operand, false, true); break;
        case MatchTest::after: widen(_lower, operand, false, false); break;
        }
    }
}

void MatchAlternatives::widen(std::optional<Bound>& bound, std::string_view operand, bool isInclusive, bool isUpper) {
    const auto order = bound ? compareVersionString(operand, bound->operand) : std::weak_ordering::equivalent;
    const bool isWider = !bound || (isUpper ? order > 0 : order < 0) || (order == 0 && isInclusive);
    if (isWider) bound = Bound{std::string(operand), isInclusive};
}

bool MatchAlternatives::accepts(std::string_view value) const {
    const std::string comparable = comparableVersion(value);
    if (_equal.contains(comparable)) return true;
    if (_unequal.size() > 1 || (_unequal.size() == 1 && *_unequal.begin() != comparable)) return true;
    if (_upper) {
        const auto order = compareVersionString(value, _upper->operand);
        if (order < 0 || (order == 0 && _upper->isInclusive)) return true;
    }
    if (_lower) {
        const auto order = compareVersionString(value, _lower->operand);
        if (order > 0 || (order == 0 && _lower->isInclusive)) return true;
    }
    if (_is.contains(std::string(value))) return true;
    if (_conforms.empty()) return false;
    const auto types = _types.supertypes(value);
    return std::any_of(types.begin(), types.end(), [&](const std::string& type) { return _conforms.contains(type); });
}

} // namespace zbd
