#include "Zembra/ZBSandboxExtension.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/SystemLogFake.h"

#include <cerrno>
#include <gtest/gtest.h>
#include <string>
#include <vector>

namespace {

using platform::LogLevel;
using platform::URL;
using support::processLog;
using zembra::ZBSandboxExtension;

class SandboxExtensionTest : public testing::Test {
protected:
    SandboxExtensionTest() {
        sandbox.allowFile("/Share.appex");
        token = *zembra::issueFileReadToken(sandbox, URL::file("/Share.appex"));
        processLog.clear();
    }

    /// The messages, all of which have to be of the debug level.
    static std::vector<std::string> debugMessages() {
        for (const auto& line : processLog.lines()) EXPECT_EQ(line.level, LogLevel::debug) << line.message;
        return processLog.messages("sandbox");
    }

    support::FakeSandbox sandbox;
    std::string token;
};

TEST_F(SandboxExtensionTest, IssueAsksForTheRightClass) {
    sandbox.files["/Link.appex"] = "/Real.appex";
    sandbox.services.insert("org.example.share");
    // The fake's tokens tell what they are for.
    const auto file = zembra::issueFileReadToken(sandbox, URL::file("/Link.appex/"));
    EXPECT_EQ(*file, "file:com.nordane.app-sandbox.read:/Real.appex");
    const auto service = zembra::issueServiceLookupToken(sandbox, "org.example.share");
    EXPECT_EQ(*service, "service:com.nordane.zembra.plugin-service:org.example.share");
    EXPECT_EQ(debugMessages(),
              (std::vector<std::string>{"issued file extension for /Link.appex -> " + *file,
                                        "issued mach extension for org.example.share -> " + *service}));

    EXPECT_FALSE(zembra::issueFileReadToken(sandbox, URL::file("/Link.appex"), "/Link.appex"));
    sandbox.issueError = ENOENT;
    processLog.clear();
    EXPECT_EQ(zembra::issueFileReadToken(sandbox, URL::file("/Link.appex")).error().code, ENOENT);
    EXPECT_EQ(zembra::issueServiceLookupToken(sandbox, "org.example.share").error().code, ENOENT);
    EXPECT_TRUE(processLog.lines().empty()); // the caller knows what to say of it
}

TEST_F(SandboxExtensionTest, ConsumesOnceAndExpelsOnce) {
    const auto extension = ZBSandboxExtension::initWithExtension(sandbox, token);
    EXPECT_EQ(extension->handle(), -1);
    extension->consume();
    extension->consume();
    const auto handle = std::to_string(extension->handle());
    EXPECT_NE(handle, "-1");
    extension->expel();
    extension->expel();
    EXPECT_EQ(extension->handle(), -1);
    EXPECT_EQ(sandbox.consumed, 1);
    EXPECT_EQ(sandbox.released, 1);
    EXPECT_EQ(debugMessages(), (std::vector<std::string>{"consuming extension " + token + " -> " + handle,
                                                         "releasing extension " + handle}));
}

TEST_F(SandboxExtensionTest, AFailedConsumeMayBeTriedAgain) {
    const auto extension = ZBSandboxExtension::initWithExtension(sandbox, token);
    sandbox.consumeError = EPERM;
    extension->consume();
    EXPECT_EQ(extension->handle(), -1);
    EXPECT_TRUE(
        processLog.contains(LogLevel::standard, "sandbox", "failed to consume extension " + token + " - errno=1"));
    sandbox.consumeError = 0;
    extension->consume();
    EXPECT_NE(extension->handle(), -1);
}

TEST_F(SandboxExtensionTest, AFailedExpelCountsAsDone) {
    const auto extension = ZBSandboxExtension::initWithExtension(sandbox, token);
    extension->consume();
    const auto handle = std::to_string(extension->handle());
    sandbox.releaseError = EINVAL;
    extension->expel();
    EXPECT_EQ(extension->handle(), -1);
    EXPECT_TRUE(
        processLog.contains(LogLevel::standard, "sandbox", "failed to release extension " + handle + " - errno=22"));
}

TEST_F(SandboxExtensionTest, DestructionExpels) {
    {
        const auto extension = ZBSandboxExtension::initWithExtension(sandbox, token);
        extension->consume();
        EXPECT_EQ(*extension, *ZBSandboxExtension::initWithExtension(sandbox, token)); // whatever their handles
        EXPECT_NE(*extension, *ZBSandboxExtension::initWithExtension(sandbox, "another"));
        EXPECT_EQ(sandbox.released, 0);
    }
    EXPECT_EQ(sandbox.released, 1);
}

} // namespace
