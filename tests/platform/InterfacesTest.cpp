#include "platform/linux/Interfaces.h"

#include <gtest/gtest.h>

namespace {

using platform::InterfaceSide;

TEST(Interfaces, CreateIsRefusedOnceRegistered) {
    platform::linux_::Interfaces interfaces;
    const auto first = interfaces.create("I");
    const auto second = interfaces.create("I");
    ASSERT_TRUE(first && second);
    EXPECT_FALSE(interfaces.find("I")) << "not before it is registered";
    EXPECT_EQ(interfaces.registerInterface(first), first);
    EXPECT_EQ(interfaces.registerInterface(second), first) << "what others already use stays";
    EXPECT_EQ(interfaces.find("I"), first);
    EXPECT_FALSE(interfaces.create("I"));
}

TEST(InterfaceDescription, KeepsOperationsArgumentsAndSidesApart) {
    platform::linux_::Interfaces interfaces;
    const auto description = interfaces.describe(interfaces.create("I"));
    const auto nested = interfaces.describe(interfaces.create("J"));
    description->setClasses({"A", "B"}, "o", 0, InterfaceSide::request);
    description->setInterface(nested, "o", 1, InterfaceSide::reply);
    EXPECT_EQ(description->classes("o", 0, InterfaceSide::request), (std::set<std::string>{"A", "B"}));
    EXPECT_EQ(description->nestedInterface("o", 1, InterfaceSide::reply), nested);
    EXPECT_TRUE(description->classes("o", 0, InterfaceSide::reply).empty());
    EXPECT_TRUE(description->classes("o", 1, InterfaceSide::request).empty());
    EXPECT_TRUE(description->classes("p", 0, InterfaceSide::request).empty());
    EXPECT_FALSE(description->nestedInterface("o", 0, InterfaceSide::reply));
}

} // namespace
