#include "platform/linux/PrivacyConsent.h"
#include "tests/support/BundleTree.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using platform::Dictionary;
using Records = std::map<std::string, std::optional<bool>>;

constexpr const char* identifier = "com.example.editor";

struct World {
    World() {
        umask(022); // what a group could write is not believed
        support::writeManifest(application, Dictionary{{"VBBundleIdentifier", identifier}});
    }
    void store(const Dictionary& grants) { support::writeFile(file, *platform::encodeXML(grants)); }
    std::optional<Records> records() {
        const auto information =
            consent.informationForBundle(*bundles.fromPath(application, platform::BundleMode::directory));
        if (!information) return std::nullopt;
        Records records;
        for (const auto& record : *information) records[record.service] = record.granted;
        return records;
    }

    support::ScratchDirectory scratch;
    support::FakeBundles bundles; // of which the path is asked
    const std::string application = scratch / "Applications/Editor.app";
    const std::string file = scratch / "var/db/PrivacyConsent.vlist";
    platform::linux_::PrivacyConsent consent{platform::linux_::Root(scratch.path())};
};

TEST(PrivacyConsent, BelievesNothingThatOthersCouldHaveWritten) {
    std::vector<std::pair<const char*, std::function<void(const std::string&)>>> spoilings{
        {"writable for the group", [](const auto& path) { chmod(path.c_str(), 0775); }},
        {"a link", support::putBehindLink},
    };
    if (geteuid() == 0)
        spoilings.emplace_back("foreign", [](const auto& path) { (void)!chown(path.c_str(), 65534, 65534); });
    for (const char* name :
         {"var/db", "var/db/PrivacyConsent.vlist", "Applications/Editor.app", "Applications/Editor.app/Info.vlist"}) {
        for (const auto& [how, spoil] : spoilings) {
            World world;
            world.store({{identifier, Dictionary{{"network", true}}}});
            EXPECT_TRUE(world.records());
            spoil(world.scratch / name);
            support::processLog.clear();
            EXPECT_FALSE(world.records()) << name << " " << how;
            EXPECT_EQ(support::processLog.lines().size(), 1U) << name << " " << how;
        }
    }
}

} // namespace
