#include "Zembra/ZBInterfaceUtilities.h"
#include "tests/support/InterfacesFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using zembra::compoundInterface;

struct InterfaceUtilities : testing::Test {
    support::FakeInterfaces interfaces;
    const std::shared_ptr<Interface> a = interfaces.add("A"), b = interfaces.add("B");
    const std::shared_ptr<InterfaceDescription> description = interfaces.describe(a);

    InterfaceUtilities() {
        for (const char* name : {"ClassA", "ClassB"}) interfaces.addClass(name);
    }
    Failure specify(const std::string& operation, std::string_view classes) {
        return zembra::interfaceClassSpecification(interfaces, *description, operation, classes);
    }
    std::set<std::string> classes(const std::string& operation, std::int64_t argument, InterfaceSide side) {
        return description->classes(operation, argument, side);
    }
};

TEST_F(InterfaceUtilities, CompoundIsMadeOnceForTheSameNames) {
    Failure error;
    const auto compound = compoundInterface(interfaces, Array{"A", "B"}, &error);
    ASSERT_TRUE(compound);
    EXPECT_EQ(compound->name(), "__XX_COMPOUND__A__B");
    EXPECT_EQ(compound->included(), (std::vector{a, b}));
    EXPECT_EQ(compoundInterface(interfaces, Array{"A", "B"}, &error), compound);
    EXPECT_NE(compoundInterface(interfaces, Array{"B", "A"}, &error), compound);
    EXPECT_EQ(compoundInterface(interfaces, Array(), &error)->name(), "__XX_COMPOUND");
    EXPECT_EQ(compoundInterface(interfaces, "A", &error), a);
    EXPECT_FALSE(compoundInterface(interfaces, 5, &error) || compoundInterface(interfaces, Value(), &error) || error);

    interfaces.overtaken.insert("__XX_COMPOUND__A"); // another thread makes it at the same time
    const auto shared = compoundInterface(interfaces, Array{"A"}, nullptr);
    EXPECT_TRUE(shared && interfaces.find("__XX_COMPOUND__A") == shared);
    // Without one of its parts or its name there is none.
    EXPECT_FALSE(compoundInterface(interfaces, Array{"A", "Z"}, &error) || interfaces.find("__XX_COMPOUND__A__Z"));
    const char* missing =
        "unable to locate protocol \"Z\" - check that it is defined and not inadvertently optimized away";
    EXPECT_EQ(error, (Error{"Zembra", 12, missing}));
    EXPECT_TRUE(support::logged(LogLevel::standard, missing));
    EXPECT_FALSE(compoundInterface(interfaces, Array{"A", 5}, nullptr));
    interfaces.taken.insert("__XX_COMPOUND__B");
    EXPECT_FALSE(compoundInterface(interfaces, Array{"B"}, &error));
    EXPECT_EQ(error, (Error{"Zembra", 12, "unable to create compound protocol"}));
}

TEST_F(InterfaceUtilities, SpecificationDescribesArguments) {
    EXPECT_FALSE(specify("open", "") || specify("open", "request:0:{ClassA+ClassB},reply:1:B"));
    EXPECT_EQ(classes("open", 0, InterfaceSide::request), (std::set<std::string>{"ClassA", "ClassB"}));
    EXPECT_TRUE(classes("open", 0, InterfaceSide::reply).empty());
    EXPECT_EQ(description->nestedInterface("open", 1, InterfaceSide::reply)->interface(), b);
    // Of the index counts what reads as a number at its front.
    const std::pair<std::int64_t, std::vector<std::string>> indices[] = {
        {7, {"7", "+7", " \t\n\v\f\r+7x"}},
        {-7, {"-7"}},
        {0, {"", " ", "x7", "+", "++7", "+-7", "-+7", "+ 7"}},
        {INT64_MIN, {" -99999999999999999999"}},
        {INT64_MAX, {"99999999999999999999"}}};
    for (const auto& [index, texts] : indices)
        for (const std::string& operation : texts) { // each its own
            EXPECT_EQ(specify(operation, "reply:" + operation + ":{ClassA}"), std::nullopt);
            EXPECT_FALSE(classes(operation, index, InterfaceSide::reply).empty()) << operation;
        }
}

TEST_F(InterfaceUtilities, SpecificationQuotesWhatIsMalformed) {
    const auto refuses = [&](const std::string& text, const std::string& quoted) {
        EXPECT_EQ(specify("open", text), (Error{"Zembra", 6, quoted})) << text;
    };
    for (const char* whole : {"request:0", "request:0:A:B", ","}) refuses(whole, whole);
    for (const std::string type : {"", "Z", "{", "{ClassA"}) refuses("request:0:" + type, type);
    for (const char* text : {"request:0:{}", "request:0:{ClassA+}"}) refuses(text, "");
    refuses("Request:0:A", "Request");
    refuses("request:0:{ClassA+ClassZ}", "ClassZ");
    EXPECT_TRUE(classes("open", 0, InterfaceSide::request).empty());

    // Entries before the faulty one have taken effect, those behind it not.
    const std::string mixed = "request:0:{ClassA},reply:0,request:1:{ClassA}";
    EXPECT_EQ(specify("open", mixed)->description, mixed);
    EXPECT_FALSE(classes("open", 0, InterfaceSide::request).empty());
    EXPECT_TRUE(classes("open", 1, InterfaceSide::request).empty());
}

} // namespace
