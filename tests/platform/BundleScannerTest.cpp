#include "platform/linux/BundleScanner.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/Entitlements.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ScratchDirectory.h"

#include <chrono>
#include <fcntl.h>
#include <functional>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <vector>

// Whether what was known of a bundle is still believed, and nothing that changed is overlooked.

namespace {

using namespace platform;
using namespace platform::linux_;
using State = ScannedBundle::State;

class ScannedPlugIn : public testing::Test {
protected:
    ScannedPlugIn() {
        support::writeManifest(bundle, manifest("1"));
        support::writeFile(bundle + "/program", "code");
        support::writeFile(bundle + "/Resources/en/Localizable.vlist", *encodeXML(Dictionary{{"key", "one"}}));
    }

    static Dictionary manifest(const std::string& version) {
        return support::plugInInfo("a", {}, {{"VBBundleExecutable", "program"}, {"VBBundleVersion", version}});
    }
    ScannedBundle scan(const BundleFactsRef& known) {
        const Descriptor directory = openDirectory(bundle);
        return scanner.scan(directory.get(), bundle, BundleKind::plugIn, known);
    }
    /// Facts that are believed: the files must be old enough for that.
    BundleFactsRef believed() {
        const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        BundleFactsRef facts;
        while (!facts || facts->evidence == 0) {
            facts = scan(nullptr).facts;
            if (!facts || std::chrono::steady_clock::now() > end) return nullptr;
        }
        return facts;
    }

    support::ScratchDirectory scratch;
    const std::string bundle = scratch / "a.appex";
    SharedStrings strings;
    const BundleScanner scanner{[](int, const std::string&) {}, strings};
};

TEST_F(ScannedPlugIn, IsReadAgainAfterEachChangeAndOnlyThen) {
    struct Change {
        const char* what;
        std::function<void()> make;
        bool changesContent;
    };
    const std::string manifestPath = bundle + "/Info.vlist";
    const std::vector<Change> changes{
        {"manifest of the same size and time",
         [&] {
             struct stat before{};
             ASSERT_EQ(stat(manifestPath.c_str(), &before), 0);
             support::writeManifest(bundle, manifest("2"));
             const timespec times[] = {before.st_atim, before.st_mtim};
             ASSERT_EQ(utimensat(AT_FDCWD, manifestPath.c_str(), times, 0), 0);
         },
         true},
        {"program", [&] { support::writeFile(bundle + "/program", "more"); }, false},
        {"entitlements",
         [&] { ASSERT_FALSE(writeEntitlements(bundle + "/program", Dictionary{{"com.nordane.any", true}})); }, true},
        {"string table", [&] { support::writeFile(bundle + "/Resources/en/Localizable.vlist", "other"); }, true},
        {"another language", [&] { support::writeFile(bundle + "/Resources/de/Localizable.vlist", "x"); }, true},
        {"no resources", [&] { std::filesystem::remove_all(bundle + "/Resources"); }, true},
        {"resources again", [&] { support::writeFile(bundle + "/Resources/fr/InfoVlist.vlist", "x"); }, true},
        {"another directory",
         [&] {
             std::filesystem::copy(bundle, scratch / "copy", std::filesystem::copy_options::recursive);
             std::filesystem::rename(bundle, scratch / "old");
             std::filesystem::rename(scratch / "copy", bundle);
             ASSERT_FALSE(writeEntitlements(bundle + "/program", Dictionary{{"com.nordane.any", true}}));
         },
         false},
    };
    for (const auto& [what, make, changesContent] : changes) {
        const auto known = believed();
        ASSERT_TRUE(known) << what;
        const auto unchanged = scan(known);
        EXPECT_EQ(unchanged.state, State::unchanged) << "before " << what;
        EXPECT_EQ(unchanged.facts, known);
        EXPECT_TRUE(BundleScanner::isUnchanged(bundle, BundleKind::plugIn, *known)) << "before " << what;
        make();
        EXPECT_FALSE(BundleScanner::isUnchanged(bundle, BundleKind::plugIn, *known)) << what;
        const auto changed = scan(known);
        ASSERT_EQ(changed.state, State::read) << what;
        EXPECT_EQ(changed.facts->fingerprint != known->fingerprint, changesContent) << what;
        EXPECT_EQ(changed.facts->evidence, 0U) << what << ": too recent to be believed";
    }
}

TEST_F(ScannedPlugIn, TakesNoProgramFromElsewhere) {
    support::writeFile(scratch / "program", "code");
    ASSERT_FALSE(writeEntitlements(scratch / "program", Dictionary{{"com.nordane.any", true}}));
    std::filesystem::create_symlink(scratch / "program", bundle + "/link");
    for (const char* name : {"../program", "link", "..", ""}) {
        support::writeManifest(bundle, support::plugInInfo("a", {}, {{"VBBundleExecutable", name}}));
        const auto scanned = scan(nullptr);
        ASSERT_EQ(scanned.state, State::read) << name;
        EXPECT_FALSE(scanned.facts->entitlements) << name;
    }
}

TEST_F(ScannedPlugIn, IsUnusableBeyondTheLimitsOfAManifest) {
    // The manifest itself is one container, and its values are the others.
    const auto nested = [](std::size_t nesting) {
        Value value = "core";
        for (std::size_t i = 1; i < nesting; ++i) value = Array{value};
        return support::plugInInfo("a", {}, {{"deep", value}});
    };
    // Beside the array stand five values: identifier, plug-in dictionary, protocol, attributes and the array itself.
    const auto filled = [](std::size_t values) {
        return support::plugInInfo("a", {}, {{"many", Array(std::vector<Value>(values - 5, Value(true)))}});
    };
    struct Limit {
        Dictionary most, tooMuch;
        const char* reason;
    };
    for (const auto& [most, tooMuch, reason] :
         {Limit{nested(maximumManifestNesting), nested(maximumManifestNesting + 1), "nested too deep"},
          Limit{filled(maximumManifestValues), filled(maximumManifestValues + 1), "more than 20000 values"}}) {
        support::writeManifest(bundle, most);
        const auto taken = scan(nullptr);
        ASSERT_EQ(taken.state, State::read) << taken.reason;
        const StoredDictionary stored(taken.facts->info->encoded(), strings, StoredDictionary::Keeps::encoding);
        EXPECT_EQ(stored.dictionary(), most) << "also read back";
        support::writeManifest(bundle, tooMuch);
        const auto refused = scan(nullptr);
        EXPECT_EQ(refused.state, State::unusable);
        EXPECT_TRUE(refused.reason.starts_with("Info.vlist: ")) << refused.reason;
        EXPECT_NE(refused.reason.find(reason), std::string::npos) << refused.reason;
    }
}

} // namespace
