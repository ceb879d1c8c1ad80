#include "platform/linux/ActivationRules.h"
#include "tests/support/ActivationRulesFake.h"

#include <gtest/gtest.h>

TEST(ActivationRules, AcceptNothingUnlessTheFakeIsTold) {
    platform::linux_::ActivationRules rules;
    support::FakeActivationRules fake;
    EXPECT_FALSE(rules.evaluate(true, {{"items", 1}}));
    EXPECT_FALSE(fake.evaluate(true, {{"items", 1}}));
    fake.verdict = true;
    EXPECT_TRUE(fake.evaluate(true, {{"items", 1}}));
}
