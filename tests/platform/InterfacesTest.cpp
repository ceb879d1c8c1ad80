#include "platform/linux/Interfaces.h"

#include <gtest/gtest.h>

TEST(InterfacesCreate, IsRefusedOnceRegistered) {
    platform::linux_::Interfaces interfaces;
    const auto first = interfaces.create("I");
    const auto second = interfaces.create("I");
    EXPECT_FALSE(interfaces.find("I")) << "not before it is registered";
    EXPECT_EQ(interfaces.registerInterface(first), first);
    EXPECT_EQ(interfaces.registerInterface(second), first) << "what others already use stays";
    EXPECT_EQ(interfaces.find("I"), first);
    EXPECT_FALSE(interfaces.create("I"));
}
