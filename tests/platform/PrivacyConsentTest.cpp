#include "platform/linux/PrivacyConsent.h"
#include "platform/linux/Bundles.h"
#include "platform/linux/Files.h"
#include "tests/support/BundleTree.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/PrivacyConsentFake.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <functional>
#include <gtest/gtest.h>
#include <map>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using platform::Dictionary;
using platform::MutableDictionary;

constexpr const char* identifier = "com.example.editor";

class LinuxConsent {
public:
    LinuxConsent() {
        umask(022); // what a group could write is not believed
        support::writeManifest(application, Dictionary{{"VBBundleIdentifier", identifier}});
    }
    /// Without `granted` the file says neither true nor false.
    void decide(const std::string& bundle, const std::string& service, std::optional<bool> granted) {
        auto& services = decided.try_emplace(bundle).first->second;
        services.set(service, granted ? platform::Value(*granted) : platform::Value(1));
        MutableDictionary content;
        for (const auto& [key, value] : decided) content.set(key, value);
        support::writeFile(grants, *platform::encodeXML(content));
    }
    auto bundle() { return bundles.fromPath(application, platform::BundleMode::directory); }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};
    platform::linux_::Bundles bundles{files};
    const std::string application = scratch / "Applications/Editor.app";
    const std::string grants = root.database() + "/PrivacyConsent.vlist";
    std::map<std::string, MutableDictionary> decided;
    platform::linux_::PrivacyConsent consent{root};
};

class FakeConsent {
public:
    FakeConsent() { bundles.add("/Editor.app", {{"VBBundleIdentifier", identifier}}); }
    void decide(const std::string& bundle, const std::string& service, std::optional<bool> granted) {
        consent.decide(bundle, service, granted);
    }
    auto bundle() { return bundles.fromPath("/Editor.app", platform::BundleMode::directory); }

    support::FakeBundles bundles;
    support::FakePrivacyConsent consent;
};

using Records = std::map<std::string, std::optional<bool>>;
std::optional<Records> recordsOf(platform::PrivacyConsent& consent, const platform::BundleObject& bundle) {
    consent.flushBundleCaches(bundle);
    const auto information = consent.informationForBundle(bundle);
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
    EXPECT_EQ(recordsOf(world.consent, *world.bundle()), Records());
    world.decide("com.example.other", "camera", true);
    EXPECT_EQ(recordsOf(world.consent, *world.bundle()), Records());
    world.decide(identifier, "network", true);
    world.decide(identifier, "camera", false);
    world.decide(identifier, "odd", std::nullopt);
    EXPECT_EQ(recordsOf(world.consent, *world.bundle()),
              (Records{{"network", true}, {"camera", false}, {"odd", std::nullopt}}));
}

TEST(FakePrivacyConsent, TellsOldAnswersUntilFlushedAndNoneWhenUnavailable) {
    FakeConsent world;
    EXPECT_TRUE(world.consent.informationForBundle(*world.bundle())->empty());
    world.decide(identifier, "network", true);
    EXPECT_TRUE(world.consent.informationForBundle(*world.bundle())->empty());
    EXPECT_EQ(recordsOf(world.consent, *world.bundle()), (Records{{"network", true}}));
    world.consent.isUnavailable = true;
    EXPECT_EQ(recordsOf(world.consent, *world.bundle()), std::nullopt);
}

TEST(PrivacyConsentOnLinux, BelievesNothingThatOthersCouldHaveWritten) {
    using Spoiling = std::pair<const char*, std::function<void(const std::string&)>>;
    std::vector<Spoiling> spoilings{
        {"writable for the group", [](const std::string& path) { chmod(path.c_str(), 0775); }},
        {"writable for all", [](const std::string& path) { chmod(path.c_str(), 0757); }},
        {"a link",
         [](const std::string& path) {
             std::filesystem::rename(path, path + ".moved");
             std::filesystem::create_symlink(path + ".moved", path);
         }},
    };
    if (geteuid() == 0) {
        spoilings.emplace_back("foreign", [](const std::string& path) { (void)!chown(path.c_str(), 65534, 65534); });
    }
    for (const char* name :
         {"var/db", "var/db/PrivacyConsent.vlist", "Applications/Editor.app", "Applications/Editor.app/Info.vlist"}) {
        for (const auto& [how, spoil] : spoilings) {
            LinuxConsent world;
            world.decide(identifier, "network", true);
            ASSERT_EQ(recordsOf(world.consent, *world.bundle()), (Records{{"network", true}}));
            spoil(world.scratch / name);
            support::processLog.clear();
            EXPECT_EQ(recordsOf(world.consent, *world.bundle()), std::nullopt) << name << " " << how;
            EXPECT_EQ(support::processLog.lines().size(), 1U) << name << " " << how;
        }
    }
}

TEST(PrivacyConsentOnLinux, TellsNothingFromWhatCannotBeUnderstood) {
    LinuxConsent world;
    for (const std::string& content : {std::string("<vlist>"), *platform::encodeXML("text"),
                                       *platform::encodeXML(Dictionary{{identifier, "text"}})}) {
        support::writeFile(world.grants, content);
        EXPECT_EQ(recordsOf(world.consent, *world.bundle()), std::nullopt) << content;
    }
    world.decide("", "network", true);
    support::writeManifest(world.application, Dictionary{{"VBBundleName", "Editor"}});
    EXPECT_EQ(recordsOf(world.consent, *world.bundle()), std::nullopt) << "no identifier";
}

} // namespace
