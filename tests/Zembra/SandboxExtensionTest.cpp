#include "Zembra/ZBSandboxExtension.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using namespace zembra;
using support::logged;

TEST(SandboxExtension, ConsumesAndExpelsOnce) {
    support::FakeSandbox sandbox;
    sandbox.services.insert("a");
    const auto extension = ZBSandboxExtension::initWithExtension(sandbox, *issueServiceLookupToken(sandbox, "a"));
    sandbox.consumeError = EPERM;
    extension->consume();
    EXPECT_TRUE(logged(LogLevel::standard, "failed to consume extension <token> - errno=1", "sandbox"));
    sandbox.consumeError = 0; // a failed one may be tried again
    for (int i = 0; i < 2; ++i) extension->consume();
    EXPECT_EQ(sandbox.consumed, 1);
    for (int i = 0; i < 2; ++i) extension->expel();
    ZBSandboxExtension::initWithExtension(sandbox, *issueServiceLookupToken(sandbox, "a"))->consume();
    EXPECT_EQ(sandbox.released, 2) << "once each, the second by its destruction";
    extension->consume();
    sandbox.releaseError = EINVAL;
    extension->expel();
    EXPECT_EQ(extension->handle(), -1) << "a failed expel counts as done";
    EXPECT_TRUE(logged(LogLevel::standard, "failed to release extension 3 - errno=22", "sandbox"));
}

} // namespace
