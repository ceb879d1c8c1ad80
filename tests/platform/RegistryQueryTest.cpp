#include "platform/linux/RegistryQuery.h"
#include "platform/linux/RegistrySnapshot.h"
#include "tests/support/TypeConformanceFake.h"
#include "zbd/MatchOperators.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <random>

// What the indexes may leave out: nothing that the full match would accept.

namespace {

using namespace platform;
using namespace platform::linux_;

SharedStrings strings;
std::mt19937 generator(20240229); // the same data in every run

std::size_t upTo(std::size_t limit) { return std::uniform_int_distribution<std::size_t>(0, limit - 1)(generator); }
template <class T> const T& oneOf(const std::vector<T>& choice) { return choice[upTo(choice.size())]; }

bool accepts(const Value& value, const Value& pattern) {
    if (const auto values = value.array())
        return std::ranges::any_of(*values, [&](const Value& one) { return accepts(one, pattern); });
    static support::FakeTypeConformance types;
    const auto text = value.string();
    return text && zbd::MatchAlternatives(pattern.array().value_or(Array{pattern}), types).accepts(*text);
}

bool accepts(const InstalledPlugIn& plugIn, const Dictionary& query) {
    const Dictionary info = plugIn.facts->info->dictionary();
    const auto extension = info.dictionary("VKExtension");
    const auto attributes = extension ? extension->dictionary("VKExtensionAttributes") : std::nullopt;
    return std::ranges::all_of(query, [&](const auto& entry) {
        if (entry.name() == "VKUserElection" || entry.name() == "ENTITLEMENT:x") return true; // not the registry's
        Value value = attributes ? (*attributes)[entry.name()] : Value();
        if (!value) value = info[entry.name()];
        if (entry.name() == "VKExtensionIdentifier" && plugIn.identifier) value = *plugIn.identifier;
        if (entry.name() == "com.nordane.uuid") value = plugIn.uuid.text();
        if (entry.value.kind() == Kind::boolean) return static_cast<bool>(value) == *entry.value.boolean();
        return accepts(value, entry.value);
    });
}

TEST(StoredDictionary, WhatManyHoldIsHeldOnceAmongAnyNumberOfOtherTexts) {
    std::vector<std::unique_ptr<StoredDictionary>> all;
    for (int i = 0; i < 10'000; ++i) {
        MutableDictionary content{{"own", "text " + std::to_string(i)}};
        for (int key = 0; key < 10; ++key) content.set(std::to_string(key), "common " + std::to_string(key));
        std::string encoded;
        appendCompact(encoded, content);
        all.push_back(std::make_unique<StoredDictionary>(encoded, strings, StoredDictionary::Keeps::whatWasAskedFor));
        (void)all.back()->dictionary();
    }
    const auto addressIn = [](const StoredDictionary& stored, const std::string& key) {
        return stored.dictionary().string(key)->data();
    };
    // The first ones may meet a text that is about to go.
    for (int key = 0; key < 10; ++key)
        EXPECT_EQ(addressIn(*all[5'000], std::to_string(key)), addressIn(*all.back(), std::to_string(key))) << key;
}

TEST(RegistrySnapshot, MatchingLeavesOutNothingThatMatches) {
    const std::vector<std::string> keys{"k1", "k2", "k3", "VKExtensionIdentifier", "VKExtensionPointIdentifier"};
    const std::vector<std::string> texts{"a",    "A",   "",    "1",    "01",   "10", "0",   "00",  "1.0", "1.00",
                                         "a01b", "a1b", "0.1", "0.01", "x0y0", "0a", "00a", "id1", "id2", "id02"};
    const std::vector<std::string> operators{"=", "<>", "<", ">=", "?KT-IS:"};
    const auto anyValue = [&]() -> Value {
        const auto kind = upTo(5);
        if (kind == 0) return static_cast<std::int64_t>(upTo(3));
        return kind == 1 ? Value(Array{oneOf(texts), 1, oneOf(texts)}) : Value(oneOf(texts));
    };
    const auto anyEntries = [&] {
        MutableDictionary entries;
        for (const auto& key : keys)
            if (upTo(2) == 0) entries.set(key, anyValue());
        return entries;
    };
    PlugIns plugIns;
    for (int i = 0; i < 300; ++i) {
        MutableDictionary info = anyEntries();
        if (upTo(4) != 0) info.set("VKExtension", Dictionary{{"VKExtensionAttributes", anyEntries()}});
        std::string encoded;
        appendCompact(encoded, info);
        const auto keeps = i % 2 == 0 ? StoredDictionary::Keeps::encoding : StoredDictionary::Keeps::whatWasAskedFor;
        const auto facts = std::make_shared<BundleFacts>();
        facts->info = std::make_shared<const StoredDictionary>(encoded, strings, keeps);
        const auto plugIn = std::make_shared<InstalledPlugIn>();
        plugIn->uuid = UUID::random();
        if (upTo(5) != 0) plugIn->identifier = "id" + std::to_string(upTo(20));
        plugIn->facts = facts;
        plugIns["/p" + std::to_string(i)] = plugIn;
    }
    Installed installed;
    for (const auto& [path, plugIn] : plugIns) installed.plugIns.push_back(plugIn);
    const RegistrySnapshot snapshot(installed, {});
    std::size_t left = 0;
    std::size_t wanted = 0;
    for (int round = 0; round < 500; ++round) {
        MutableDictionary query;
        for (std::size_t i = 0; i <= upTo(3); ++i) {
            Value pattern = upTo(4) == 0 ? Value(oneOf(operators) + oneOf(texts)) : anyValue();
            if (upTo(8) == 0) pattern = upTo(2) == 0;
            query.set(oneOf(keys), pattern);
        }
        if (upTo(20) == 0) query.set("com.nordane.uuid", std::next(plugIns.begin(), 7)->second->uuid.text());
        if (upTo(20) == 0) query.set(upTo(2) == 0 ? "VKUserElection" : "ENTITLEMENT:x", oneOf(texts));
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

    MutableDictionary many;
    for (int i = 0; i < 1000; ++i) many.set(std::to_string(i), "x");
    EXPECT_LE(equalityTests(many).size(), 16U) << "a host must not make the registry build a thousand indexes";
}

} // namespace
