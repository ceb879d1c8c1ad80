#include "Zembra/ZBSandboxExtension.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using zembra::ZBSandboxExtension;

TEST(SandboxExtension, IssueAsksForTheRightClass) {
    const URL link = URL::file("/Link.appex/");
    support::FakeSandbox sandbox;
    sandbox.files["/Link.appex"] = "/Real.appex";
    sandbox.services.insert("org.example.share");
    // The fake's tokens tell what they are for.
    EXPECT_EQ(*zembra::issueFileReadToken(sandbox, link), "file:com.nordane.app-sandbox.read:/Real.appex");
    EXPECT_EQ(*zembra::issueServiceLookupToken(sandbox, "org.example.share"),
              "service:com.nordane.zembra.plugin-service:org.example.share");
    EXPECT_TRUE(logged(LogLevel::debug, "issued file extension for /Link.appex -> <token>", "sandbox"));
    EXPECT_TRUE(logged(LogLevel::debug, "issued mach extension for org.example.share -> <token>", "sandbox"));
    EXPECT_FALSE(zembra::issueFileReadToken(sandbox, link, "/Link.appex"));
    sandbox.issueError = ENOENT;
    EXPECT_EQ(zembra::issueFileReadToken(sandbox, link).error().code, ENOENT);
    EXPECT_EQ(zembra::issueServiceLookupToken(sandbox, "org.example.share").error().code, ENOENT);
}

TEST(SandboxExtension, ConsumesAndExpelsOnce) {
    support::FakeSandbox sandbox;
    sandbox.services.insert("org.example.share");
    const std::string token = *zembra::issueServiceLookupToken(sandbox, "org.example.share");
    const auto extension = ZBSandboxExtension::initWithExtension(sandbox, token);
    sandbox.consumeError = EPERM;
    extension->consume();
    EXPECT_EQ(extension->handle(), -1);
    EXPECT_TRUE(logged(LogLevel::standard, "failed to consume extension <token> - errno=1", "sandbox"));
    sandbox.consumeError = 0; // a failed one may be tried again
    for (int i = 0; i < 2; ++i) extension->consume();
    EXPECT_EQ(sandbox.consumed, 1);
    EXPECT_EQ(*extension, *ZBSandboxExtension::initWithExtension(sandbox, token)); // whatever their handles
    EXPECT_NE(*extension, *ZBSandboxExtension::initWithExtension(sandbox, "another"));
    for (int i = 0; i < 2; ++i) extension->expel();
    ZBSandboxExtension::initWithExtension(sandbox, token)->consume();
    EXPECT_EQ(sandbox.released, 2) << "once each, the second by its destruction";
    extension->consume();
    sandbox.releaseError = EINVAL;
    extension->expel();
    EXPECT_EQ(extension->handle(), -1) << "a failed expel counts as done";
    EXPECT_TRUE(logged(LogLevel::standard, "failed to release extension 3 - errno=22", "sandbox"));
}

} // namespace
