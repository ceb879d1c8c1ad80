#include "Zembra/ZBBundle.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::processLog;
using zembra::ZBBundle;

TEST(Bundle, ExecutablePathFallsBackToTheDirectory) {
    support::FakeBundles bundles;
    bundles.add("/App.app", {}, "/App.app/Run");
    bundles.mainExecutable = "/App.app/Run";
    EXPECT_EQ(ZBBundle::initForMainBundle(bundles)->path(), "/App.app");
    EXPECT_EQ(ZBBundle::initWithExecutablePath(bundles, "/App.app/Run")->url(), URL::file("/App.app"));
    EXPECT_EQ(ZBBundle::initWithExecutableURL(bundles, URL::file("/App.app/"))->executablePath(), "/App.app/Run");
    EXPECT_EQ(ZBBundle::initWithURL(bundles, URL::file("/Data.app"))->executablePath(), "/Data.app");
    const auto nowhere = ZBBundle::initWithQMXBundle(bundles.fromPath("/none", BundleMode::executable));
    EXPECT_FALSE(nowhere->url() || nowhere->executablePath());
}

TEST(Bundle, KeepsItsSupportPathAndLogsThatThereIsNoInfoDictionary) {
    support::FakeBundles bundles;
    auto& content = bundles.add("/App.app", {{"VBBundleIdentifier", "org.example.app"}});
    const auto bundle = ZBBundle::initWithPath(bundles, "/App.app");
    content.hasSupportPath = false;
    EXPECT_EQ(bundle->plugInsPath(), std::nullopt);
    content.hasSupportPath = true;
    EXPECT_EQ(bundle->plugInsPath(), "/App.app/PlugIns");
    content.hasSupportPath = false;
    EXPECT_EQ(bundle->bundleDirectory(""), "/App.app");

    processLog.clear();
    EXPECT_EQ(bundle->bundleIdentifier(), "org.example.app");
    content.manifest = {{"VBBundleIdentifier", 5}};
    EXPECT_FALSE(bundle->bundleIdentifier() || !processLog.lines().empty());
    content.hasReadableManifest = false;
    EXPECT_EQ(bundle->bundleIdentifier(), std::nullopt);
    EXPECT_EQ(processLog.messages("ops"),
              (std::vector<std::string>{"failed to retrieve Info.vlist for /App.app through <bundle /App.app>",
                                        "failed to convert Info.vlist to dictionary: /App.app source=(null)"}));
    EXPECT_EQ(processLog.lines().front().level, LogLevel::info);
}

} // namespace
