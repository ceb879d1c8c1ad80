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
    const auto takePiece = [](std::string_view& text) {
        const bool isNumber = text.find_first_of("0123456789") == 0;
        const auto end = isNumber ? text.find_first_not_of("0123456789") : std::min<std::size_t>(text.size(), 1);
        const auto piece = text.substr(0, end);
        text.remove_prefix(piece.size());
        return isNumber ? std::to_string(std::stoull(std::string(piece))) + "#" : std::string(piece);
    };
    while (!left.empty() && !right.empty()) {
        if (takePiece(left) != takePiece(right)) return false;
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
    const Dictionary info = plugIn.facts->info->dictionary();
    const auto extension = info.dictionary("VKExtension");
    const auto attributes = extension ? extension->dictionary("VKExtensionAttributes") : std::nullopt;
    return std::ranges::all_of(query, [&](const auto& entry) {
        Value value = attributes ? (*attributes)[entry.name()] : Value();
        if (!value) value = info[entry.name()];
        if (entry.name() == "VKExtensionIdentifier" && plugIn.identifier) value = *plugIn.identifier;
        if (entry.name() == "com.nordane.uuid") value = plugIn.uuid.text();
        if (entry.value.kind() == Kind::boolean) return static_cast<bool>(value) == *entry.value.boolean();
        return accepts(value, entry.value);
    });
}

InstalledPlugInRef plugIn(const std::string& path, std::optional<std::string> identifier, const Dictionary& info,
                          StoredDictionary::Keeps keeps) {
    static SharedStrings strings;
    std::string encoded;
    appendCompact(encoded, info);
    auto facts = std::make_shared<BundleFacts>();
    facts->info = std::make_shared<const StoredDictionary>(encoded, strings, keeps);
    auto record = std::make_shared<InstalledPlugIn>();
    record->path = path;
    record->uuid = UUID::random();
    record->identifier = std::move(identifier);
    record->facts = facts;
    return record;
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
    const std::vector<std::string> texts{"a",    "A",   "",    "1",    "01",   "10", "0",   "00",  "1.0", "1.00",
                                         "a01b", "a1b", "0.1", "0.01", "x0y0", "0a", "00a", "id1", "id2", "id02"};
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
        const auto keeps = i % 2 == 0 ? StoredDictionary::Keeps::encoding : StoredDictionary::Keeps::whatWasAskedFor;
        plugIns[path] = plugIn(path, identifier, info, keeps);
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
        EXPECT_EQ(snapshot.matching(equalityTests(query)), answer) << "asked again";
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

TEST(StoredDictionary, FindsInTheEncodingWhatTheDictionaryHolds) {
    static SharedStrings strings;
    const Dictionary inner{{"a", 1}, {"b", Array{"x", Array{}, true}}, {"", "empty"}};
    const Dictionary outer{{"r", 1.5}, {"d", Value::data("bytes")}, {"t", Date{1}}, {"in", inner}, {"last", false}};
    std::string bytes;
    appendCompact(bytes, outer);
    const auto stored = [](std::string_view encoded) {
        return StoredDictionary(encoded, strings, StoredDictionary::Keeps::whatWasAskedFor);
    };
    const auto whole = stored(bytes);
    for (int round = 0; round < 2; ++round) { // encoded, and then decoded
        for (const auto& [key, value] : outer) EXPECT_EQ(whole.find({*key.string()}), value) << *key.string();
        for (const auto& [key, value] : inner) EXPECT_EQ(whole.find({"in", *key.string()}), value) << *key.string();
        for (const auto& names : {std::initializer_list<std::string_view>{"none"}, {"in", "none"}, {"r", "a"}})
            EXPECT_FALSE(whole.find(names));
        EXPECT_EQ(whole.dictionary(), outer);
        EXPECT_EQ(whole.encoded(), bytes);
    }
    // Damage leads nowhere outside the bytes, which the sanitizers watch.
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        std::string damaged = bytes;
        damaged[i] = static_cast<char>(damaged[i] ^ 0xFF);
        for (const auto& encoding : {damaged, bytes.substr(0, i)}) {
            (void)stored(encoding).find({"in", "b"});
            (void)stored(encoding).find({"last"});
            EXPECT_NE(stored(encoding).dictionary(), outer) << i;
        }
    }
}

} // namespace
