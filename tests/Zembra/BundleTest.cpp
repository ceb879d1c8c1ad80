#include "Zembra/ZBBundle.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using zembra::ZBBundle;

TEST(Bundle, AnswersWhatTheSystemKnows) {
    support::FakeBundles bundles;
    auto& content = bundles.add("/App.app", {{"VBBundleIdentifier", "org.example.app"}}, "/App.app/Run");
    EXPECT_EQ(ZBBundle::initWithURL(bundles, URL::file("/Data.app"))->executablePath(), "/Data.app");
    const auto bundle = ZBBundle::initWithExecutableURL(bundles, URL::file("/App.app/Run"));
    EXPECT_EQ(bundle->url(), URL::file("/App.app"));
    EXPECT_EQ(bundle->executablePath(), "/App.app/Run");
    EXPECT_EQ(bundle->plugInsPath(), "/App.app/PlugIns");
    EXPECT_EQ(bundle->bundleIdentifier(), "org.example.app");
    content.hasReadableManifest = false;
    EXPECT_EQ(bundle->bundleIdentifier(), std::nullopt);
    for (const char* line : {"failed to retrieve Info.vlist for /App.app through <bundle /App.app>",
                             "failed to convert Info.vlist to dictionary: /App.app source=(null)"})
        EXPECT_TRUE(support::logged(LogLevel::info, line));
}

} // namespace
