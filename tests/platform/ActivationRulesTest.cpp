#include "platform/linux/ActivationRules.h"

#include <gtest/gtest.h>

TEST(ActivationRules, AcceptNothing) {
    EXPECT_FALSE(platform::linux_::ActivationRules().evaluate(true, {{"items", 1}}));
}
