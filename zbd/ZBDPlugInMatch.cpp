#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "zbd/MatchOperators.h"
#include "zbd/ZBDPlugIn.h"
#include "zbd/ZBDServer.h"

#include <algorithm>

namespace zbd {

namespace log = zembra::log;
namespace ruleKey = zembra::ruleKey;
using platform::Dictionary;
using platform::Value;

namespace {

/// Bits of an election that rules do not see.
constexpr std::int64_t unseenElectionBits = 0xFF00;

} // namespace

bool ZBDPlugIn::match(const std::optional<Dictionary>& rules) const { return !mismatch(MatchRules(rules)); }

std::optional<RuleMismatch> ZBDPlugIn::mismatch(const MatchRules& rules) const {
    std::optional<RuleFacts> facts; // looked up once for all rules: hosts may send a hundred thousand
    for (const MatchRule& rule : rules) {
        Value value = valueForRule(*rule.key().string(), facts);
        if (!accepts(rule, value)) return RuleMismatch{rule.key(), rule.pattern(), std::move(value)};
    }
    return std::nullopt;
}

bool ZBDPlugIn::matchKey(std::string_view key, const Value& pattern) const {
    std::optional<RuleFacts> facts;
    return accepts({Value(key), pattern}, valueForRule(key, facts));
}

Value ZBDPlugIn::valueForRule(std::string_view key, std::optional<RuleFacts>& facts) const {
    if (key.starts_with(ruleKey::entitlementPrefix)) {
        return valueForEntitlement(key.substr(ruleKey::entitlementPrefix.size()));
    }
    if (key == ruleKey::containingApp) return containingPath();
    Value value;
    if (key == ruleKey::identifier) value = identifier();
    if (key == ruleKey::uuid) value = uuidText();
    if (key == ruleKey::userElection) value = userElection();
    if (value) return value;
    if (!facts) {
        const auto info = bundleInfoDictionary().value_or(Dictionary());
        const auto declared = info.dictionary(zembra::manifest::extension).value_or(Dictionary());
        facts = {info, declared.dictionary(zembra::manifest::attributes).value_or(Dictionary())};
    }
    value = facts->attributes[key];
    return value ? value : facts->info[key];
}

std::string ZBDPlugIn::userElection() const {
    const auto annotation = ZBDServer::server()->annotationForPlugIn(*this);
    const Value election = annotation ? (*annotation)[zembra::annotationKey::election] : Value();
    return std::to_string(election.integerValue().value_or(0) & ~unseenElectionBits);
}

bool ZBDPlugIn::accepts(const MatchRule& rule, const Value& value) const {
    if (!value && rule.key().string() == ruleKey::containingApp) return false;
    if (rule.pattern() == Value(true)) return value && !(value == Value(false));
    if (rule.pattern() == Value(false)) return !value || value == Value(false);
    if (!value) return false;
    if (const auto items = rule.pattern().dictionary()) return matchDictionary(value, *items);
    const auto fits = [&](const Value& single) {
        const auto text = single.string();
        if (!text) return false;
        const auto* alternatives = rule.alternatives(_platform.typeConformance);
        return alternatives != nullptr ? alternatives->accepts(*text) : matchValue(*text, rule.pattern());
    };
    if (const auto elements = value.array()) return std::any_of(elements->begin(), elements->end(), fits);
    return fits(value);
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
