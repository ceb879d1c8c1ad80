#include "platform/linux/PrivacyConsent.h"
#include "tests/support/BundleTree.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/PrivacyConsentFake.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using platform::Dictionary;
using Records = std::map<std::string, std::optional<bool>>;

constexpr const char* identifier = "com.example.editor";

struct LinuxConsent {
    LinuxConsent() {
        umask(022); // what a group could write is not believed
        support::writeManifest(application, Dictionary{{"VBBundleIdentifier", identifier}});
    }
    /// Without a flag the file says neither true nor false.
    void decide(const std::string& bundle, const Records& records) {
        platform::MutableDictionary services;
        for (const auto& [service, granted] : records)
            services.set(service, granted ? platform::Value(*granted) : platform::Value(1));
        support::writeFile(grants, *platform::encodeXML(Dictionary{{bundle, services}}));
    }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    support::FakeBundles bundles; // of which the path is asked
    const std::string application = scratch / "Applications/Editor.app";
    const std::string grants = root.database() + "/PrivacyConsent.vlist";
    platform::linux_::PrivacyConsent consent{root};
};

struct FakeConsent {
    FakeConsent() { bundles.add(application, {{"VBBundleIdentifier", identifier}}); }
    void decide(const std::string& bundle, const Records& records) {
        for (const auto& [service, granted] : records) consent.decide(bundle, service, granted);
    }

    const std::string application = "/Editor.app";
    support::FakeBundles bundles;
    support::FakePrivacyConsent consent;
};

std::optional<Records> recordsOf(auto& world) {
    const auto bundle = world.bundles.fromPath(world.application, platform::BundleMode::directory);
    world.consent.flushBundleCaches(*bundle);
    const auto information = world.consent.informationForBundle(*bundle);
    if (!information) return std::nullopt;
    Records records;
    for (const auto& record : *information) records[record.service] = record.granted;
    return records;
}

template <class World> class PrivacyConsentConformance : public testing::Test {};
using Worlds = testing::Types<LinuxConsent, FakeConsent>;
TYPED_TEST_SUITE(PrivacyConsentConformance, Worlds);

TYPED_TEST(PrivacyConsentConformance, TellsWhatIsStoredNowForThatApplication) {
    TypeParam world;
    EXPECT_EQ(recordsOf(world), Records());
    world.decide("com.example.other", {{"camera", true}});
    EXPECT_EQ(recordsOf(world), Records());
    const Records records{{"network", true}, {"camera", false}, {"odd", std::nullopt}};
    world.decide(identifier, records);
    EXPECT_EQ(recordsOf(world), records);
}

TEST(PrivacyConsentOnLinux, BelievesNothingThatOthersCouldHaveWritten) {
    std::vector<std::pair<const char*, std::function<void(const std::string&)>>> spoilings{
        {"writable for the group", [](const auto& path) { chmod(path.c_str(), 0775); }},
        {"writable for all", [](const auto& path) { chmod(path.c_str(), 0757); }},
        {"a link", support::putBehindLink},
    };
    if (geteuid() == 0)
        spoilings.emplace_back("foreign", [](const auto& path) { (void)!chown(path.c_str(), 65534, 65534); });
    for (const char* name :
         {"var/db", "var/db/PrivacyConsent.vlist", "Applications/Editor.app", "Applications/Editor.app/Info.vlist"}) {
        for (const auto& [how, spoil] : spoilings) {
            LinuxConsent world;
            world.decide(identifier, {{"network", true}});
            EXPECT_TRUE(recordsOf(world));
            spoil(world.scratch / name);
            support::processLog.clear();
            EXPECT_FALSE(recordsOf(world)) << name << " " << how;
            EXPECT_EQ(support::processLog.lines().size(), 1U) << name << " " << how;
        }
    }
}

TEST(PrivacyConsentOnLinux, TellsNothingFromWhatCannotBeUnderstood) {
    LinuxConsent world;
    for (const std::string& content : {std::string("<vlist>"), *platform::encodeXML("text"),
                                       *platform::encodeXML(Dictionary{{identifier, "text"}})}) {
        support::writeFile(world.grants, content);
        EXPECT_FALSE(recordsOf(world)) << content;
    }
    world.decide("", {{"network", true}});
    support::writeManifest(world.application, Dictionary{{"VBBundleName", "Editor"}});
    EXPECT_FALSE(recordsOf(world)) << "no identifier";
}

} // namespace
