#include "Zembra/ZBInterfaceUtilities.h"
#include "tests/support/InterfacesFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <limits>

namespace {

using platform::Array;
using platform::Failure;
using platform::InterfaceSide;
using platform::Value;
using zembra::compoundInterface;
using zembra::interfaceClassSpecification;

class InterfaceUtilitiesTest : public testing::Test {
protected:
    InterfaceUtilitiesTest() {
        for (const char* name : {"A", "B"}) {
            interfaces.add(name);
            interfaces.addClass(std::string("Class") + name);
        }
        description = interfaces.describe(interfaces.find("A"));
    }

    support::FakeInterfaces interfaces;
    std::shared_ptr<platform::InterfaceDescription> description;
};

TEST_F(InterfaceUtilitiesTest, LookupReportsAMissingInterface) {
    EXPECT_EQ(zembra::interfaceLookup(interfaces, "A", nullptr), interfaces.find("A"));
    support::processLog.clear();
    Failure error;
    EXPECT_EQ(zembra::interfaceLookup(interfaces, "Z", &error), nullptr);
    const std::string text =
        "unable to locate protocol \"Z\" - check that it is defined and not inadvertently optimized away";
    EXPECT_EQ(error, (platform::Error{"Zembra", 12, text}));
    EXPECT_TRUE(support::processLog.contains(platform::LogLevel::standard, "ops", text));
    EXPECT_EQ(zembra::interfaceLookup(interfaces, "Z", nullptr), nullptr);
}

TEST_F(InterfaceUtilitiesTest, CompoundIsMadeOnceForTheSameNames) {
    Failure error;
    const auto compound = compoundInterface(interfaces, Array{"A", "B"}, &error);
    ASSERT_TRUE(compound);
    EXPECT_EQ(compound->name(), "__XX_COMPOUND__A__B");
    EXPECT_EQ(compound->included(), (std::vector{interfaces.find("A"), interfaces.find("B")}));
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", "B"}, &error), compound);
    EXPECT_NE(compoundInterface(interfaces, Array{"B", "A"}, &error), compound);
    const auto empty = compoundInterface(interfaces, Array(), &error);
    ASSERT_TRUE(empty);
    EXPECT_EQ(empty->name(), "__XX_COMPOUND");
    EXPECT_TRUE(empty->included().empty());
    EXPECT_EQ(compoundInterface(interfaces, "A", &error), interfaces.find("A"));
    EXPECT_EQ(compoundInterface(interfaces, Value(5), &error), nullptr);
    EXPECT_EQ(compoundInterface(interfaces, Value(), &error), nullptr);
    EXPECT_EQ(error, std::nullopt);
}

TEST_F(InterfaceUtilitiesTest, CompoundMadeTwiceAtOnceIsTheSameForAll) {
    interfaces.overtaken.insert("__XX_COMPOUND__A");
    const auto compound = compoundInterface(interfaces, Array{"A"}, nullptr);
    ASSERT_TRUE(compound);
    EXPECT_EQ(interfaces.find("__XX_COMPOUND__A"), compound);
}

TEST_F(InterfaceUtilitiesTest, CompoundOfAMissingInterfaceIsNotRegistered) {
    Failure error;
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", "Z"}, &error), nullptr);
    EXPECT_EQ(error->code, 12);
    EXPECT_EQ(interfaces.find("__XX_COMPOUND__A__Z"), nullptr);
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", 5}, nullptr), nullptr);
}

TEST_F(InterfaceUtilitiesTest, CompoundFailsWhenItCanNeitherBeMadeNorFound) {
    interfaces.taken.insert("__XX_COMPOUND__A");
    Failure error;
    EXPECT_EQ(compoundInterface(interfaces, Array{"A"}, &error), nullptr);
    EXPECT_EQ(error, (platform::Error{"Zembra", 12, "unable to create compound protocol"}));
}

TEST_F(InterfaceUtilitiesTest, SpecificationDescribesArguments) {
    EXPECT_EQ(interfaceClassSpecification(interfaces, *description, "open", ""), std::nullopt);
    EXPECT_EQ(interfaceClassSpecification(interfaces, *description, "open",
                                          "request:0:{ClassA+ClassB},reply:1:B,reply:99999999999999999999:{ClassA}"),
              std::nullopt);
    EXPECT_EQ(description->classes("open", 0, InterfaceSide::request), (std::set<std::string>{"ClassA", "ClassB"}));
    EXPECT_TRUE(description->classes("open", 0, InterfaceSide::reply).empty());
    const auto nested = description->nestedInterface("open", 1, InterfaceSide::reply);
    ASSERT_TRUE(nested);
    EXPECT_EQ(nested->interface(), interfaces.find("B"));
    constexpr auto last = std::numeric_limits<std::int64_t>::max();
    EXPECT_EQ(description->classes("open", last, InterfaceSide::reply), std::set<std::string>{"ClassA"});
}

TEST_F(InterfaceUtilitiesTest, SpecificationReadsTheFrontOfTheIndex) {
    const std::pair<const char*, std::int64_t> cases[] = {
        {"7", 7},
        {"-7", -7},
        {"+7", 7},
        {" \t\n\v\f\r+7x", 7},
        {"", 0},
        {" ", 0},
        {"x7", 0},
        {"+", 0},
        {"++7", 0},
        {"+-7", 0},
        {"-+7", 0},
        {"+ 7", 0},
        {" -99999999999999999999", std::numeric_limits<std::int64_t>::min()},
    };
    for (const auto& [text, index] : cases) {
        const std::string operation = text; // each its own
        EXPECT_EQ(interfaceClassSpecification(interfaces, *description, operation,
                                              "reply:" + std::string(text) + ":{ClassA}"),
                  std::nullopt);
        EXPECT_FALSE(description->classes(operation, index, InterfaceSide::reply).empty()) << '"' << text << '"';
    }
}

TEST_F(InterfaceUtilitiesTest, SpecificationQuotesWhatIsMalformed) {
    const std::vector<std::pair<std::string_view, std::string>> cases = {
        {"request:0", "request:0"},
        {"request:0:A:B", "request:0:A:B"},
        {",", ","},
        {"Request:0:A", "Request"},
        {"request:0:", ""},
        {"request:0:Z", "Z"},
        {"request:0:{ClassA", "{ClassA"},
        {"request:0:{", "{"},
        {"request:0:{}", ""},
        {"request:0:{ClassA+ClassZ}", "ClassZ"},
        {"request:0:{ClassA+}", ""},
    };
    for (const auto& [specification, quoted] : cases) {
        EXPECT_EQ(interfaceClassSpecification(interfaces, *description, "open", specification),
                  (platform::Error{"Zembra", 6, quoted}))
            << specification;
    }
    EXPECT_TRUE(description->classes("open", 0, InterfaceSide::request).empty());

    // Entries before the faulty one have taken effect, those behind it not.
    const std::string_view mixed = "request:0:{ClassA},reply:0,request:1:{ClassA}";
    EXPECT_EQ(interfaceClassSpecification(interfaces, *description, "open", mixed)->description, mixed);
    EXPECT_FALSE(description->classes("open", 0, InterfaceSide::request).empty());
    EXPECT_TRUE(description->classes("open", 1, InterfaceSide::request).empty());
}

} // namespace
