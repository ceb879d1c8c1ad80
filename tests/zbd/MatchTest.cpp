#include "tests/support/FakeDaemon.h"
#include "zbd/MatchOperators.h"

#include <gtest/gtest.h>

#include <random>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::MutableArray;
using platform::Value;
using support::processLog;

struct Match : testing::Test {
    support::FakeDaemon daemon;
    zbd::ZBDPlugInRef plugIn;

    Match() {
        daemon.fake.typeConformance.declare("text.markdown", "text");
        auto described = support::dataPlugIn("data");
        described.path = "/Applications/A.app/PlugIns/data.plugin";
        described.containingBundle = std::make_shared<platform::ApplicationRecord>(
            platform::ApplicationRecord{platform::URL::file("/Applications/A.app"), "com.example.a", "A"});
        described.entitlements = Dictionary{{"granted", true}, {"level", 0}, {"groups", Array{"a", "b"}}};
        described.info = support::manifestOf("com.example.data",
                                             {{"VKExtensionProtocol", "#Data"},
                                              {"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", "1.9"},
                                                                                   {"both", "attribute"},
                                                                                   {"type", "text.markdown"},
                                                                                   {"no", "NO"},
                                                                                   {"ten", "10"},
                                                                                   {"zero", 0},
                                                                                   {"two", 2},
                                                                                   {"off", false},
                                                                                   {"items", Dictionary()},
                                                                                   {"none", Array{}},
                                                                                   {"mixed", Array{7, "5", "6"}}}}});
        auto info = platform::MutableDictionary::copyOf(described.info);
        info.set("both", "manifest");
        info.set("only", "manifest");
        described.info = info;
        described.uuid = platform::UUID::parse("0F0E0D0C-0B0A-0908-0706-050403020100");
        daemon.fake.registry.install(described);
        plugIn = daemon.server->findPlugIn(*described.uuid);
        processLog.clear();
    }
};

TEST_F(Match, KeysAndPatterns) {
    struct Case {
        std::string key;
        Value pattern;
        bool matches;
    };
    const std::vector<Case> cases{
        // What a key names.
        {"VKExtensionIdentifier", "com.example.data", true},
        {"VKExtensionIdentifier", "com.example.Data", false},
        {"com.nordane.uuid", "0F0E0D0C-0B0A-0908-0706-050403020100", true},
        {"com.nordane.uuid", "0f0e0d0c-0b0a-0908-0706-050403020100", false},
        {"VKUserElection", "0", true},
        {"VKExtensionContainingApp", "/Applications/A.app", true},
        {"VKExtensionContainingApp", false, false},
        {"both", "attribute", true},
        {"both", "manifest", false},
        {"only", "manifest", true},
        {"ENTITLEMENT:granted", true, true},
        {"ENTITLEMENT:groups", "b", true},
        {"ENTITLEMENT:level", true, false}, // the number 0 is the boolean false
        {"ENTITLEMENT:only", true, false},  // no falling back to the manifest
        // Presence.
        {"absent", true, false},
        {"absent", false, true},
        {"absent", "", false},
        {"off", true, false},
        {"off", false, true},
        {"zero", 1, false},
        {"zero", 0, true},
        {"no", true, true},
        {"no", false, false},
        {"two", 1, true},
        {"two", 2, false},
        {"two", "2", false},
        {"items", "x", false},
        {"items", Dictionary{{"a", 1}}, false},
        // Operators.
        {"ten", "10", true},
        {"ten", "=10", true},
        {"ten", "==10", false},
        {"ten", ">9", true},
        {"ten", ">10", false},
        {"ten", ">=10", true},
        {"ten", "<10", false},
        {"ten", "<=10", true},
        {"ten", "<>10", false},
        {"ten", "<>9", true},
        {"ten", "=0010", true},
        {"VKExtensionVersion", "<1.10", true},
        {"ten", " 10", false},
        {"ten", "1*", false},
        {"ten", "", false},
        {"ten", ">", true},
        {"type", "?KT-CONFORMS:text", true},
        {"type", "?KT-CONFORMS:text.markdown", true},
        {"type", "?KT-IS:text", false},
        {"type", "?KT-IS:text.markdown", true},
        {"type", "?KT-conforms:text", false},
        // Alternatives on either side.
        {"ten", Array{"9", "10"}, true},
        {"ten", Array{"9", "11"}, false},
        {"ten", Array{}, false},
        {"ten", Array{10, Array{"10"}, "?x", "10"}, true},
        {"mixed", "5", true},
        {"mixed", "<>5", true},
        {"mixed", "7", false}, // a number among the values is not text
        {"mixed", Array{"4", "6"}, true},
        {"none", "<>5", false},
        {"none", true, true},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(plugIn->matchKey(c.key, c.pattern), c.matches) << c.key << " against " << c.pattern.description();
    }
    // Outside applications no pattern fits the containing one, not even that there is none.
    auto loose = support::dataPlugIn("loose");
    loose.path = "/System/loose.plugin";
    const auto outside = daemon.server->findPlugIn(*daemon.fake.registry.install(loose)->uuid);
    ASSERT_TRUE(outside);
    for (const Value& pattern : {Value(false), Value(true), Value("x"), Value("<>x")}) {
        EXPECT_FALSE(outside->matchKey("VKExtensionContainingApp", pattern)) << pattern.description();
    }
}

TEST_F(Match, EveryRuleHasToHoldAndTheFirstThatDoesNotIsTold) {
    EXPECT_TRUE(plugIn->match(std::nullopt));
    EXPECT_TRUE(plugIn->match(Dictionary()));
    EXPECT_TRUE(plugIn->match(Dictionary{{"ten", "10"}, {"no", true}}));
    const auto mismatch = plugIn->mismatch(
        zbd::MatchRules(Dictionary{{"ten", "10"}, {"no", "YES"}, {"absent", true}}, daemon.fake.typeConformance));
    ASSERT_TRUE(mismatch);
    EXPECT_EQ(mismatch->key, Value("no"));
    EXPECT_EQ(mismatch->pattern, Value("YES"));
    EXPECT_EQ(mismatch->value, Value("NO"));
}

TEST_F(Match, ElectionsShowWithoutTheirSecondByte) {
    for (const auto& [election, shown] : {std::pair<std::int64_t, const char*>{1, "1"},
                                          {257, "1"},
                                          {0xFF02, "2"},
                                          {0x10000, "65536"},
                                          {-1, "-65281"}}) {
        daemon.server->setAnnotation(Dictionary{{"election", election}}, *plugIn);
        EXPECT_TRUE(plugIn->matchKey("VKUserElection", shown)) << election;
    }
}

TEST_F(Match, UnknownOperatorsAreLoggedAndMatchNothing) {
    EXPECT_FALSE(plugIn->matchKey("ten", "?LIKE:10"));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops", "unrecognized match operator:?LIKE:10"));
}

TEST_F(Match, DictionaryPatternsAreForTheActivationRules) {
    daemon.fake.activationRules.verdict = true;
    auto described = support::dataPlugIn("other");
    described.info =
        support::manifestOf("com.example.other", {{"VKExtensionProtocol", "#Data"},
                                                  {"VKExtensionAttributes", Dictionary{{"activation", "rule"}}}});
    daemon.fake.registry.install(described);
    const auto other = daemon.server->findPlugIn(*described.uuid);
    EXPECT_TRUE(other->matchKey("activation", Dictionary{{"a", 1}}));
    EXPECT_EQ(daemon.fake.activationRules.asked.back(), (std::pair{Value("rule"), Dictionary{{"a", 1}}}));
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "extension",
                                    "evaluating VKExtension filter: " + Value(Dictionary{{"a", 1}}).description() +
                                        " value: rule"));
}

TEST_F(Match, ManyAlternativesAnswerLikeOneByOne) {
    daemon.fake.typeConformance.declare("text", "data");
    const std::vector<std::string> operators{"", "=", "<>", "<", "<=", ">", ">=", "?KT-CONFORMS:", "?KT-IS:", "?"};
    const std::vector<std::string> texts{"", "1", "01", "1.10", "1.9", "a", "A", "text", "text.markdown", "data"};
    std::mt19937 random(7);
    const auto pick = [&](const auto& from) { return from[random() % from.size()]; };
    for (int round = 0; round < 3000; ++round) {
        MutableArray patterns;
        for (std::size_t i = random() % 4; i > 0; --i) patterns.append(pick(operators) + pick(texts));
        const zbd::MatchAlternatives alternatives(patterns, daemon.fake.typeConformance);
        for (const std::string& value : texts) {
            ASSERT_EQ(alternatives.accepts(value), plugIn->matchValue(value, Value(patterns)))
                << value << " against " << Value(patterns).description();
        }
    }
}

TEST_F(Match, LongArraysOfPatternsAreLookedUp) {
    MutableArray patterns;
    for (int i = 0; i < 10'000; ++i) patterns.append("?p" + std::to_string(i));
    EXPECT_FALSE(plugIn->matchKey("mixed", patterns)); // three values
    EXPECT_EQ(processLog.messages("ops").size(), patterns.size()) << "a line for each pattern, not for each pair";
    patterns.append("6");
    const zbd::MatchRules rules(Dictionary{{"mixed", patterns}, {"ten", patterns}}, daemon.fake.typeConformance);
    processLog.clear();
    for (int i = 0; i < 3; ++i) EXPECT_EQ(plugIn->mismatch(rules)->key, Value("ten"));
    EXPECT_TRUE(processLog.messages("ops").empty()) << "logged when they were made ready";
}

} // namespace
