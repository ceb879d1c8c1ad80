#include "platform/linux/RegistryQuery.h"
#include "platform/linux/RegistrySnapshot.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <random>

// What the indexes may leave out: nothing that the full match would accept.

namespace {

using namespace platform;
using namespace platform::linux_;

/// Equality of the match language, spelled out: runs of digits by value, everything else by byte.
bool areEqual(std::string_view left, std::string_view right) {
    const auto isDigit = [](std::string_view text) { return !text.empty() && text[0] >= '0' && text[0] <= '9'; };
    const auto takeRun = [&](std::string_view& text) {
        std::string run;
        for (; isDigit(text); text.remove_prefix(1)) {
            if (!run.empty() || text[0] != '0') run += text[0];
        }
        return run;
    };
    while (!left.empty() && !right.empty()) {
        if (isDigit(left) != isDigit(right)) return false;
        if (isDigit(left)) {
            if (takeRun(left) != takeRun(right)) return false;
        } else {
            if (left[0] != right[0]) return false;
            left.remove_prefix(1);
            right.remove_prefix(1);
        }
    }
    return left.empty() && right.empty();
}

bool accepts(const Value& value, const Value& pattern) {
    if (const auto patterns = pattern.array())
        return std::ranges::any_of(*patterns, [&](const Value& one) { return accepts(value, one); });
    if (const auto values = value.array())
        return std::ranges::any_of(*values, [&](const Value& one) { return accepts(one, pattern); });
    const auto text = value.string();
    const auto operand = pattern.string();
    if (!text || !operand) return false;
    if (operand->starts_with("<>")) return !areEqual(*text, operand->substr(2));
    if (operand->starts_with("=")) return areEqual(*text, operand->substr(1));
    return areEqual(*text, *operand);
}

bool accepts(const InstalledPlugIn& plugIn, const Dictionary& query) {
    return std::ranges::all_of(query, [&](const auto& entry) {
        const Dictionary& info = plugIn.facts->info->dictionary();
        Value value;
        if (entry.name() == "VKExtensionIdentifier" && plugIn.identifier) value = *plugIn.identifier;
        if (entry.name() == "com.nordane.uuid") value = plugIn.uuid.text();
        const auto extension = info.dictionary("VKExtension");
        const auto attributes = extension ? extension->dictionary("VKExtensionAttributes") : std::nullopt;
        if (!value && attributes) value = (*attributes)[entry.name()];
        if (!value) value = info[entry.name()];
        if (entry.value.kind() == Kind::boolean) return static_cast<bool>(value) == *entry.value.boolean();
        return accepts(value, entry.value);
    });
}

InstalledPlugInRef plugIn(const std::string& path, std::optional<std::string> identifier, Dictionary info) {
    static SharedKeys keys;
    auto facts = std::make_shared<BundleFacts>();
    facts->info = std::make_shared<const StoredDictionary>(info, keys);
    auto record = std::make_shared<InstalledPlugIn>();
    record->path = path;
    record->uuid = UUID::random();
    record->identifier = std::move(identifier);
    record->facts = facts;
    return record;
}

TEST(NormalizedForEquality, JoinsWhatComparesEqual) {
    const std::string_view texts[] = {"",    "0",    "00",  "1",   "01",   "001",  "10",   "010",  "100",
                                      "1.0", "1.00", "1.1", "a0",  "a00",  "a01b", "a1b",  "a1b0", "a01b00",
                                      "0a",  "a",    "00a", "0.1", "0.01", "0.10", "x0y0", "x00y0"};
    for (const auto left : texts) {
        for (const auto right : texts)
            EXPECT_EQ(areEqual(left, right), normalizedForEquality(left) == normalizedForEquality(right))
                << left << " and " << right;
    }
}

TEST(EqualityTests, TakePlainPatternsOnly) {
    const auto keys = [](const Dictionary& query) {
        std::vector<std::string> names;
        for (const auto& test : equalityTests(query)) names.push_back(test.key);
        return names;
    };
    EXPECT_EQ(keys({{"a", "x"}, {"b", "=x"}, {"c", Array{"x", "=y"}}, {"d", Array{}}}),
              (std::vector<std::string>{"a", "b", "c", "d"}));
    EXPECT_EQ(keys({{"a", "<>x"},
                    {"b", "<x"},
                    {"c", ">=x"},
                    {"d", "?KT-IS:x"},
                    {"e", Array{"x", "<>y"}},
                    {"f", true},
                    {"g", 2},
                    {"h", Dictionary()},
                    {"i", Array{"x", 1}},
                    {"VKUserElection", "1"},
                    {"VKExtensionContainingApp", "/x"},
                    {"ENTITLEMENT:x", "y"}}),
              std::vector<std::string>{});
    EXPECT_EQ(equalityTests({{"a", Array{"1", "=01", "1"}}})[0].values, std::vector<std::string>{"1"});

    MutableDictionary many;
    for (int i = 0; i < 1000; ++i) many.set(std::to_string(i), "x");
    EXPECT_LE(equalityTests(many).size(), 16U) << "a host must not make the registry build a thousand indexes";
}

TEST(RegistrySnapshot, MatchingLeavesOutNothingThatMatches) {
    std::mt19937 random(20240229); // the same data in every run
    const auto upTo = [&](std::size_t limit) {
        return std::uniform_int_distribution<std::size_t>(0, limit - 1)(random);
    };
    const std::vector<std::string> keys{"k1", "k2", "k3", "VKExtensionIdentifier", "VKExtensionPointIdentifier"};
    const std::vector<std::string> texts{"a", "b", "A", "1", "01", "10", "1.0", "1.00", "", "id1", "id2", "id02"};
    const auto anyValue = [&]() -> Value {
        switch (upTo(5)) {
        case 0: return static_cast<std::int64_t>(upTo(3));
        case 1: return Array{texts[upTo(texts.size())], 1, texts[upTo(texts.size())]};
        default: return texts[upTo(texts.size())];
        }
    };
    const auto anyEntries = [&] {
        MutableDictionary entries;
        for (const auto& key : keys) {
            if (upTo(2) == 0) entries.set(key, anyValue());
        }
        return entries;
    };
    PlugIns plugIns;
    for (int i = 0; i < 300; ++i) {
        MutableDictionary info = anyEntries();
        if (upTo(4) != 0) info.set("VKExtension", Dictionary{{"VKExtensionAttributes", anyEntries()}});
        const std::string path = "/p" + std::to_string(i);
        const auto identifier = upTo(5) == 0 ? std::nullopt : std::optional("id" + std::to_string(upTo(20)));
        plugIns[path] = plugIn(path, identifier, info);
    }
    const RegistrySnapshot snapshot(plugIns, {}, {});
    std::size_t left = 0;
    std::size_t wanted = 0;
    for (int round = 0; round < 500; ++round) {
        MutableDictionary query;
        for (std::size_t i = 0; i <= upTo(3); ++i) {
            Value pattern = upTo(6) == 0 ? Value("<>" + texts[upTo(texts.size())]) : anyValue();
            if (upTo(8) == 0) pattern = upTo(2) == 0;
            query.set(keys[upTo(keys.size())], pattern);
        }
        if (upTo(20) == 0) query.set("com.nordane.uuid", std::next(plugIns.begin(), 7)->second->uuid.text());
        const auto answer = snapshot.matching(equalityTests(query));
        EXPECT_TRUE(std::ranges::is_sorted(answer, {}, [](const auto& one) { return one->uuid; }));
        left += answer.size();
        for (const auto& [path, one] : plugIns) {
            if (!accepts(*one, query)) continue;
            ++wanted;
            EXPECT_NE(std::ranges::find(answer, one), answer.end()) << path << " for " << Value(query).description();
        }
    }
    EXPECT_GT(wanted, 0U);
    EXPECT_LT(left, 500U * 300U / 2U) << "the indexes leave nearly nothing out";
}

} // namespace
