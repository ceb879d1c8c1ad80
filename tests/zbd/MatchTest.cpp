#include "tests/support/Requests.h"
#include "zbd/MatchOperators.h"

#include <random>

namespace {

using namespace platform;

struct Match : support::Requests {
    const zbd::ZBDPlugInRef plugIn = withAttributes({{"VBBundleIdentifier", "x"}});

    Match() { fake.typeConformance.declare("text.markdown", "text"); }
    zbd::ZBDPlugInRef withAttributes(const Dictionary& attributes) {
        auto data = described(1, {{"VKExtensionAttributes", attributes}});
        data.uuid = UUID::parse("0F0E0D0C-0B0A-0908-0706-050403020100");
        data.entitlements = Dictionary{{"granted", true}, {"level", 0}};
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
        {"absent", false, ""},
        {"ENTITLEMENT:level", false, true},           // the number 0 is the boolean false
        {"ENTITLEMENT:VBBundleVersion", false, true}, // no falling back to the manifest
    };
    for (const auto& [key, fitting, other] : cases) {
        EXPECT_TRUE(plugIn->matchKey(key, fitting)) << key;
        EXPECT_FALSE(plugIn->matchKey(key, other)) << key;
    }
    // Without their second byte.
    for (const auto& [election, shown] : {std::pair(0xFF02, "2"), {0x10000, "65536"}, {-1, "-65281"}}) {
        daemon.server->setAnnotation(Dictionary{{"election", election}}, *plugIn);
        EXPECT_TRUE(plugIn->matchKey("VKUserElection", shown)) << election;
    }
    // Outside applications no pattern fits the containing one, not even that there is none.
    for (const Value& pattern : {Value(false), Value(true), Value("<>x")})
        EXPECT_FALSE(daemon.plugIn("outside")->matchKey("VKExtensionContainingApp", pattern)) << pattern.description();
    EXPECT_TRUE(plugIn->match(std::nullopt));
}

TEST_F(Match, PatternsAskForPresenceOrCompareText) {
    const Dictionary filter{{"a", 1}};
    // The value, the patterns that fit, and some that do not.
    const std::tuple<Value, std::vector<Value>, std::vector<Value>> cases[] = {
        {false, {false}, {true}},
        {0, {0}, {1}},
        {2, {1, true}, {2, "2"}},
        {Array(), {true}, {"<>5"}},
        {Dictionary(), {true}, {"x", filter}},
        {"10",
         {"10", "=10", ">9", ">=10", "<=10", "<>9", "=0010", ">"},
         {"==10", ">10", "<10", "<>10", " 10", "1*", ""}},
        {"1.9", {"<1.10"}, {"?LIKE:1.9"}},
        {"text.markdown",
         {"?KT-CONFORMS:text", "?KT-CONFORMS:text.markdown", "?KT-IS:text.markdown"},
         {"?KT-IS:text", "?KT-conforms:text"}},
        // Alternatives on either side; what is no text among them fits nothing.
        {"10", {Array{"9", "10"}, Array{10, Array{"10"}, "?x", "10"}}, {Array{"9", "11"}, Array{}}},
        {Array{7, "5", "6"}, {"5", "<>5", Array{"4", "6"}}, {"7"}},
        {"rule", {filter}, {}}};
    for (const auto& [value, fitting, others] : cases) {
        withAttributes({{"key", value}});
        fake.activationRules.verdict = value.string() == "rule";
        for (const Value& pattern : fitting) EXPECT_TRUE(plugIn->matchKey("key", pattern)) << pattern.description();
        for (const Value& pattern : others) EXPECT_FALSE(plugIn->matchKey("key", pattern)) << pattern.description();
    }
    EXPECT_EQ(fake.activationRules.asked.back(), (std::pair{Value("rule"), filter}));
    expectLogged(info, "unrecognized match operator:?LIKE:1.9");
    expectLogged(debug, "evaluating VKExtension filter: {a = 1} value: rule", "extension");
}

TEST_F(Match, ManyAlternativesAnswerLikeOneByOne) {
    fake.typeConformance.declare("text", "data");
    const char* const operators[] = {"", "=", "<>", "<", "<=", ">", ">=", "?KT-CONFORMS:", "?KT-IS:", "?"};
    const std::string texts[] = {"", "1", "01", "1.10", "1.9", "a", "A", "text", "text.markdown", "data"};
    std::mt19937 random(7);
    for (int round = 0; round < 3000; ++round) {
        MutableArray patterns;
        for (auto i = random() % 4; i > 0; --i) patterns.append(operators[random() % 10] + texts[random() % 10]);
        const zbd::MatchAlternatives alternatives(patterns, fake.typeConformance);
        for (const std::string& value : texts)
            ASSERT_EQ(alternatives.accepts(value), plugIn->matchValue(value, Value(patterns)))
                << value << " against " << Value(patterns).description();
    }
    MutableArray many;
    for (int i = 0; i < 20; ++i) many.append(i == 7 ? "?many" : std::to_string(i));
    const zbd::MatchRules rules(Dictionary{{"key", many}});
    const auto told = [] {
        return std::ranges::count(support::processLog.messages("ops"), "unrecognized match operator:?many");
    };
    withAttributes({});
    EXPECT_TRUE(plugIn->mismatch(rules));
    EXPECT_EQ(told(), 0) << "nothing was compared";
    withAttributes({{"key", "19"}});
    EXPECT_FALSE(plugIn->mismatch(rules) || plugIn->mismatch(rules));
    EXPECT_EQ(told(), 1);
}

} // namespace
