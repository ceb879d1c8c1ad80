#include "Zembra/ZBInterfaceUtilities.h"
#include "tests/support/InterfacesFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using namespace std::string_literals;
using enum InterfaceSide;

TEST(CompoundInterface, IsMadeOnceForTheSameNames) {
    support::FakeInterfaces interfaces;
    for (const char* name : {"A", "B"}) interfaces.add(name);
    Failure error;
    const auto compound = zembra::compoundInterface(interfaces, Array{"A", "B"}, &error);
    EXPECT_EQ(compound->name(), "__XX_COMPOUND__A__B");
    EXPECT_EQ(compound->included(), (std::vector{interfaces.find("A"), interfaces.find("B")}));
    EXPECT_EQ(zembra::compoundInterface(interfaces, Array{"A", "B"}, &error), compound);
    EXPECT_FALSE(zembra::compoundInterface(interfaces, Array{"A", "Z"}, &error));
    const char* missing =
        "unable to locate protocol \"Z\" - check that it is defined and not inadvertently optimized away";
    EXPECT_EQ(error, (Error{"Zembra", 12, missing}));
    EXPECT_TRUE(support::logged(LogLevel::standard, missing));
}

TEST(InterfaceClassSpecification, DescribesArgumentsAndQuotesWhatIsMalformed) {
    support::FakeInterfaces interfaces;
    const auto description = interfaces.describe(interfaces.add("A"));
    for (const char* name : {"ClassA", "ClassB"}) interfaces.addClass(name);
    const auto specify = [&](const std::string& operation, const std::string& classes) {
        return zembra::interfaceClassSpecification(interfaces, *description, operation, classes);
    };
    // Of the index counts what reads as a number at its front.
    EXPECT_FALSE(specify("open", "") || specify("open", "request:x:{ClassA+ClassB},reply: +7x:A"));
    EXPECT_EQ(description->classes("open", 0, request), (std::set<std::string>{"ClassA", "ClassB"}));
    EXPECT_TRUE(description->nestedInterface("open", 7, reply));
    // Entries before the faulty one have taken effect, those behind it not.
    const std::string mixed = "request:0:{ClassA},reply:0,request:1:{ClassA}";
    std::vector<std::string> quoted;
    for (const auto& text : {"request:0:A:B"s, "Request:0:A"s, "request:0:"s, "request:0:Z"s, "request:0:{"s,
                             "request:0:{}"s, "request:0:{ClassA+ClassZ}"s, mixed})
        quoted.push_back(specify(text, text)->text());
    EXPECT_EQ(quoted, (std::vector<std::string>{"request:0:A:B", "Request", "", "Z", "{", "", "ClassZ", mixed}));
    EXPECT_EQ(specify("open", ","), (Error{"Zembra", 6, ","}));
    EXPECT_FALSE(description->classes(mixed, 0, request).empty());
    EXPECT_TRUE(description->classes(mixed, 1, request).empty());
}

} // namespace
