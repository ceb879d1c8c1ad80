#include "Zembra/ZBLog.h"
#include "Zembra/ZBProtocol.h"
#include "zbd/MatchOperators.h"
#include "zbd/ZBDPlugIn.h"
#include "zbd/ZBDServer.h"

#include <algorithm>

namespace zbd {

namespace log = zembra::log;
namespace ruleKey = zembra::ruleKey;
using platform::Array;
using platform::Dictionary;
using platform::Value;

namespace {

/// Bits of an election that rules do not see.
constexpr std::int64_t unseenElectionBits = 0xFF00;

/// From this many comparisons on, an array of values is looked up among the patterns instead.
constexpr std::size_t manyComparisons = 1024;

} // namespace

bool ZBDPlugIn::match(const std::optional<Dictionary>& rules) const { return !mismatch(rules); }

std::optional<RuleMismatch> ZBDPlugIn::mismatch(const std::optional<Dictionary>& rules) const {
    if (!rules) return std::nullopt;
    for (const auto& rule : *rules) {
        Value value = valueForRule(rule.name());
        if (!accepts(rule.name(), value, rule.value)) {
            return RuleMismatch{std::string(rule.name()), rule.value, std::move(value)};
        }
    }
    return std::nullopt;
}

bool ZBDPlugIn::matchKey(std::string_view key, const Value& pattern) const {
    return accepts(key, valueForRule(key), pattern);
}

Value ZBDPlugIn::valueForRule(std::string_view key) const {
    if (key.starts_with(ruleKey::entitlementPrefix)) {
        return valueForEntitlement(key.substr(ruleKey::entitlementPrefix.size()));
    }
    if (key == ruleKey::containingApp) return containingPath();
    Value value;
    if (key == ruleKey::identifier) value = identifier();
    if (key == ruleKey::uuid) value = uuidText();
    if (key == ruleKey::userElection) value = userElection();
    if (!value) value = attribute(key);
    if (!value) value = infoKey(key);
    return value;
}

std::string ZBDPlugIn::userElection() const {
    const auto annotation = ZBDServer::server()->annotationForPlugIn(*this);
    const Value election = annotation ? (*annotation)[zembra::annotationKey::election] : Value();
    return std::to_string(election.integerValue().value_or(0) & ~unseenElectionBits);
}

bool ZBDPlugIn::accepts(std::string_view key, const Value& value, const Value& pattern) const {
    if (key == ruleKey::containingApp && !value) return false;
    if (pattern == Value(true)) return value && !(value == Value(false));
    if (pattern == Value(false)) return !value || value == Value(false);
    if (!value) return false;
    if (const auto items = pattern.dictionary()) return matchDictionary(value, *items);
    if (const auto text = value.string()) return matchValue(*text, pattern);
    if (const auto elements = value.array()) return matchElements(*elements, pattern);
    return false;
}

bool ZBDPlugIn::matchElements(const Array& elements, const Value& patterns) const {
    std::optional<MatchAlternatives> prepared;
    if (const auto alternatives = patterns.array();
        alternatives && elements.size() > 1 && alternatives->size() > manyComparisons / elements.size()) {
        prepared.emplace(*alternatives, _platform.typeConformance);
    }
    return std::any_of(elements.begin(), elements.end(), [&](const Value& element) {
        const auto text = element.string();
        if (!text) return false;
        return prepared ? prepared->accepts(*text) : matchValue(*text, patterns);
    });
}

bool ZBDPlugIn::matchValue(std::string_view value, const Value& patterns) const {
    if (const auto pattern = patterns.string()) return matchValue(value, *pattern);
    const auto alternatives = patterns.array();
    return alternatives && std::any_of(alternatives->begin(), alternatives->end(), [&](const Value& alternative) {
               const auto pattern = alternative.string();
               return pattern && matchValue(value, *pattern);
           });
}

bool ZBDPlugIn::matchValue(std::string_view value, std::string_view pattern) const {
    const MatchComparison comparison = matchComparison(pattern);
    if (comparison.test == MatchTest::unrecognized) log::ops().info("unrecognized match operator:%@", pattern);
    return evaluate(comparison, value, _platform.typeConformance);
}

bool ZBDPlugIn::matchDictionary(const Value& value, const Dictionary& pattern) const {
    log::extension().debug("evaluating VKExtension filter: %@ value: %@", pattern, value);
    return _platform.activationRules.evaluate(value, pattern);
}

} // namespace zbd
