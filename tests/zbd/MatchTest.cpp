#include "tests/support/Requests.h"
#include "zbd/MatchOperators.h"

#include <random>

namespace {

using namespace platform;
using support::processLog;

struct Match : support::Requests {
    const zbd::ZBDPlugInRef plugIn =
        withAttributes({{"VBBundleIdentifier", "x"}, {"ten", "10"}, {"mixed", Array{7, "5"}}});

    Match() {
        fake.typeConformance.declare("text.markdown", "text");
        processLog.clear();
    }
    zbd::ZBDPlugInRef withAttributes(const Dictionary& attributes) {
        auto data = described(1, {{"VKExtensionAttributes", attributes}});
        data.uuid = UUID::parse("0F0E0D0C-0B0A-0908-0706-050403020100");
        data.entitlements = Dictionary{{"granted", true}, {"level", 0}, {"groups", Array{"a", "b"}}};
        install({data});
        return daemon.server->findPlugIn(*data.uuid);
    }
};

TEST_F(Match, KeysNameFactsAttributesAndManifestEntries) {
    const std::tuple<const char*, Value, Value> cases[] = {
        // The key, a pattern that fits and one that does not.
        {"VKExtensionIdentifier", "com.example.1", "com.Example.1"},
        {"com.nordane.uuid", "0F0E0D0C-0B0A-0908-0706-050403020100", "0f0e0d0c-0b0a-0908-0706-050403020100"},
        {"VKExtensionContainingApp", application, false},
        {"VBBundleIdentifier", "x", "com.example.1"}, // the attribute, not the manifest entry
        {"VBBundleVersion", "1", false},
        {"absent", false, true},
        {"absent", false, ""},
        {"ENTITLEMENT:granted", true, false},
        {"ENTITLEMENT:groups", "b", "c"},
        {"ENTITLEMENT:level", false, true},           // the number 0 is the boolean false
        {"ENTITLEMENT:VBBundleVersion", false, true}, // no falling back to the manifest
        {"VKUserElection", "0", "1"},
    };
    for (const auto& [key, fitting, other] : cases) {
        EXPECT_TRUE(plugIn->matchKey(key, fitting)) << key;
        EXPECT_FALSE(plugIn->matchKey(key, other)) << key;
    }
    // Without their second byte.
    for (const auto& [election, shown] : {std::pair(257, "1"), {0xFF02, "2"}, {0x10000, "65536"}, {-1, "-65281"}}) {
        daemon.server->setAnnotation(Dictionary{{"election", election}}, *plugIn);
        EXPECT_TRUE(plugIn->matchKey("VKUserElection", shown)) << election;
    }
    // Outside applications no pattern fits the containing one, not even that there is none.
    const auto outside = daemon.plugIn("outside");
    for (const Value& pattern : {Value(false), Value(true), Value("<>x")})
        EXPECT_FALSE(outside->matchKey("VKExtensionContainingApp", pattern)) << pattern.description();
    EXPECT_TRUE(plugIn->match(std::nullopt));
}

TEST_F(Match, PatternsAskForPresenceOrCompareText) {
    const auto expect = [&](const Value& value, const std::vector<Value>& fitting, const std::vector<Value>& others) {
        withAttributes({{"key", value}});
        for (const Value& pattern : fitting) EXPECT_TRUE(plugIn->matchKey("key", pattern)) << pattern.description();
        for (const Value& pattern : others) EXPECT_FALSE(plugIn->matchKey("key", pattern)) << pattern.description();
    };
    const Dictionary filter{{"a", 1}};
    expect(false, {false}, {true});
    expect(0, {0}, {1});
    expect(2, {1, true}, {2, "2"});
    expect("NO", {true}, {false});
    expect(Array(), {true}, {"<>5"});
    expect(Dictionary(), {true}, {"x", filter});
    expect("10", {"10", "=10", ">9", ">=10", "<=10", "<>9", "=0010", ">"},
           {"==10", ">10", "<10", "<>10", " 10", "1*", ""});
    expect("1.9", {"<1.10"}, {"?LIKE:1.9"});
    expectLogged(info, "unrecognized match operator:?LIKE:1.9");
    expect("text.markdown", {"?KT-CONFORMS:text", "?KT-CONFORMS:text.markdown", "?KT-IS:text.markdown"},
           {"?KT-IS:text", "?KT-conforms:text"});
    // Alternatives on either side; what is no text among them fits nothing.
    expect("10", {Array{"9", "10"}, Array{10, Array{"10"}, "?x", "10"}}, {Array{"9", "11"}, Array{}});
    expect(Array{7, "5", "6"}, {"5", "<>5", Array{"4", "6"}}, {"7"});
    fake.activationRules.verdict = true;
    expect("rule", {filter}, {});
    EXPECT_EQ(fake.activationRules.asked.back(), (std::pair{Value("rule"), filter}));
    expectLogged(debug, "evaluating VKExtension filter: {a = 1} value: rule", "extension");
}

TEST_F(Match, ManyAlternativesAnswerLikeOneByOne) {
    fake.typeConformance.declare("text", "data");
    const std::vector<std::string> operators{"", "=", "<>", "<", "<=", ">", ">=", "?KT-CONFORMS:", "?KT-IS:", "?"};
    const std::vector<std::string> texts{"", "1", "01", "1.10", "1.9", "a", "A", "text", "text.markdown", "data"};
    std::mt19937 random(7);
    const auto pick = [&](const auto& from) { return from[random() % from.size()]; };
    for (int round = 0; round < 3000; ++round) {
        MutableArray patterns;
        for (std::size_t i = random() % 4; i > 0; --i) patterns.append(pick(operators) + pick(texts));
        const zbd::MatchAlternatives alternatives(patterns, fake.typeConformance);
        for (const std::string& value : texts) {
            ASSERT_EQ(alternatives.accepts(value), plugIn->matchValue(value, Value(patterns)))
                << value << " against " << Value(patterns).description();
        }
    }
}

TEST_F(Match, LongArraysOfPatternsAreLookedUp) {
    MutableArray patterns;
    for (int i = 0; i < 10'000; ++i) patterns.append("?p" + std::to_string(i));
    EXPECT_FALSE(plugIn->matchKey("mixed", patterns)); // two values
    EXPECT_EQ(processLog.messages("ops").size(), patterns.size()) << "a line for each pattern, not for each pair";
    patterns.append("5");
    const Dictionary three{{"mixed", patterns}, {"ten", patterns}, {"absent", true}};
    const zbd::MatchRules rules(three, fake.typeConformance);
    processLog.clear();
    for (int i = 0; i < 3; ++i) EXPECT_EQ(plugIn->mismatch(rules)->key, Value("ten")) << "the first that does not fit";
    EXPECT_EQ(plugIn->mismatch(rules)->value, Value("10"));
    EXPECT_TRUE(processLog.messages("ops").empty()) << "logged when they were made ready";
}

} // namespace
