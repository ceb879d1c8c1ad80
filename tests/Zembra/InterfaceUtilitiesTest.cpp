#include "Zembra/ZBInterfaceUtilities.h"
#include "tests/support/InterfacesFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <limits>

namespace {

using namespace platform;
using zembra::compoundInterface;
using Index = std::numeric_limits<std::int64_t>;

struct InterfaceUtilities : testing::Test {
    support::FakeInterfaces interfaces;
    std::shared_ptr<InterfaceDescription> description;

    InterfaceUtilities() {
        for (const char* name : {"A", "B"}) {
            interfaces.add(name);
            interfaces.addClass(std::string("Class") + name);
        }
        description = interfaces.describe(interfaces.find("A"));
    }
    Failure specify(const std::string& operation, std::string_view classes) {
        return zembra::interfaceClassSpecification(interfaces, *description, operation, classes);
    }
};

TEST_F(InterfaceUtilities, LookupReportsAMissingInterface) {
    EXPECT_EQ(zembra::interfaceLookup(interfaces, "A", nullptr), interfaces.find("A"));
    Failure error;
    EXPECT_EQ(zembra::interfaceLookup(interfaces, "Z", &error), nullptr);
    const std::string text =
        "unable to locate protocol \"Z\" - check that it is defined and not inadvertently optimized away";
    EXPECT_EQ(error, (Error{"Zembra", 12, text}));
    EXPECT_TRUE(support::logged(LogLevel::standard, text));
    EXPECT_EQ(zembra::interfaceLookup(interfaces, "Z", nullptr), nullptr);
}

TEST_F(InterfaceUtilities, CompoundIsMadeOnceForTheSameNames) {
    Failure error;
    const auto compound = compoundInterface(interfaces, Array{"A", "B"}, &error);
    ASSERT_TRUE(compound);
    EXPECT_EQ(compound->name(), "__XX_COMPOUND__A__B");
    EXPECT_EQ(compound->included(), (std::vector{interfaces.find("A"), interfaces.find("B")}));
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", "B"}, &error), compound);
    EXPECT_NE(compoundInterface(interfaces, Array{"B", "A"}, &error), compound);
    EXPECT_EQ(compoundInterface(interfaces, Array(), &error)->name(), "__XX_COMPOUND");
    EXPECT_EQ(compoundInterface(interfaces, "A", &error), interfaces.find("A"));
    EXPECT_EQ(compoundInterface(interfaces, Value(5), &error), nullptr);
    EXPECT_EQ(compoundInterface(interfaces, Value(), &error), nullptr);
    EXPECT_EQ(error, std::nullopt);

    interfaces.overtaken.insert("__XX_COMPOUND__A"); // another thread makes it at the same time
    const auto shared = compoundInterface(interfaces, Array{"A"}, nullptr);
    ASSERT_TRUE(shared);
    EXPECT_EQ(interfaces.find("__XX_COMPOUND__A"), shared);
}

TEST_F(InterfaceUtilities, CompoundFailsWithoutItsPartsOrItsName) {
    Failure error;
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", "Z"}, &error), nullptr);
    EXPECT_EQ(error->code, 12);
    EXPECT_EQ(interfaces.find("__XX_COMPOUND__A__Z"), nullptr);
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", 5}, nullptr), nullptr);
    interfaces.taken.insert("__XX_COMPOUND__A");
    EXPECT_EQ(compoundInterface(interfaces, Array{"A"}, &error), nullptr);
    EXPECT_EQ(error, (Error{"Zembra", 12, "unable to create compound protocol"}));
}

TEST_F(InterfaceUtilities, SpecificationDescribesArguments) {
    EXPECT_EQ(specify("open", ""), std::nullopt);
    EXPECT_EQ(specify("open", "request:0:{ClassA+ClassB},reply:1:B"), std::nullopt);
    EXPECT_EQ(description->classes("open", 0, InterfaceSide::request), (std::set<std::string>{"ClassA", "ClassB"}));
    EXPECT_TRUE(description->classes("open", 0, InterfaceSide::reply).empty());
    const auto nested = description->nestedInterface("open", 1, InterfaceSide::reply);
    ASSERT_TRUE(nested);
    EXPECT_EQ(nested->interface(), interfaces.find("B"));
    // Of the index counts what reads as a number at its front.
    const std::pair<std::int64_t, std::vector<const char*>> indices[] = {
        {7, {"7", "+7", " \t\n\v\f\r+7x"}},
        {-7, {"-7"}},
        {0, {"", " ", "x7", "+", "++7", "+-7", "-+7", "+ 7"}},
        {Index::min(), {" -99999999999999999999"}},
        {Index::max(), {"99999999999999999999"}},
    };
    for (const auto& [index, texts] : indices) {
        for (const std::string operation : texts) { // each its own
            EXPECT_EQ(specify(operation, "reply:" + operation + ":{ClassA}"), std::nullopt);
            EXPECT_FALSE(description->classes(operation, index, InterfaceSide::reply).empty()) << operation;
        }
    }
}

TEST_F(InterfaceUtilities, SpecificationQuotesWhatIsMalformed) {
    const std::pair<std::string, std::vector<std::string>> cases[] = {
        {"request:0", {"request:0"}},
        {"request:0:A:B", {"request:0:A:B"}},
        {",", {","}},
        {"Request", {"Request:0:A"}},
        {"", {"request:0:", "request:0:{}", "request:0:{ClassA+}"}},
        {"Z", {"request:0:Z"}},
        {"{", {"request:0:{"}},
        {"{ClassA", {"request:0:{ClassA"}},
        {"ClassZ", {"request:0:{ClassA+ClassZ}"}},
    };
    for (const auto& [quoted, texts] : cases) {
        for (const auto& text : texts) EXPECT_EQ(specify("open", text), (Error{"Zembra", 6, quoted})) << text;
    }
    EXPECT_TRUE(description->classes("open", 0, InterfaceSide::request).empty());

    // Entries before the faulty one have taken effect, those behind it not.
    const std::string mixed = "request:0:{ClassA},reply:0,request:1:{ClassA}";
    EXPECT_EQ(specify("open", mixed)->description, mixed);
    EXPECT_FALSE(description->classes("open", 0, InterfaceSide::request).empty());
    EXPECT_TRUE(description->classes("open", 1, InterfaceSide::request).empty());
}

} // namespace
