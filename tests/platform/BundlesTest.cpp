#include "platform/linux/Bundles.h"
#include "platform/linux/Files.h"
#include "tests/support/BundleTree.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using platform::BundleMode;
using platform::BundleProperty;
using platform::Dictionary;
using platform::Value;

/// Bundles on disk.
struct LinuxBundles {
    void add(const std::string& name, const Dictionary& manifest, const std::string& executable = "") {
        std::string bytes(platform::compactMagic); // the other encoding is used in the cases for this implementation
        platform::appendCompact(bytes, manifest);
        support::writeFile(path(name + "/Info.vlist"), bytes);
        if (!executable.empty()) support::writeFile(path(name + "/" + executable), "program");
    }
    std::string path(const std::string& name) const { return scratch / name; }

    support::ScratchDirectory scratch;
    platform::linux_::Files files{platform::linux_::Root("/")};
    platform::linux_::Bundles bundles{files};
};

struct FakeBundles {
    void add(const std::string& name, const Dictionary& manifest, const std::string& executable = "") {
        bundles.add(path(name), manifest,
                    executable.empty() ? std::nullopt : std::optional(path(name + "/" + executable)));
    }
    std::string path(const std::string& name) const { return "/scratch/" + name; }

    support::FakeBundles bundles;
};

template <class World> class BundlesConformance : public testing::Test {
protected:
    World world;
};
using Worlds = testing::Types<LinuxBundles, FakeBundles>;
TYPED_TEST_SUITE(BundlesConformance, Worlds);

TYPED_TEST(BundlesConformance, DirectoryModeDescribesTheBundle) {
    auto& here = this->world;
    here.add("A.app", {{"VBBundleIdentifier", "a"}, {"VBBundleExecutable", "bin/a"}}, "bin/a");
    const auto bundle = here.bundles.fromPath(here.path("A.app") + "/", BundleMode::directory);
    EXPECT_EQ(bundle->property(BundleProperty::path), here.path("A.app"));
    EXPECT_EQ(bundle->property(BundleProperty::supportPath), here.path("A.app"));
    EXPECT_EQ(bundle->property(BundleProperty::executablePath), here.path("A.app/bin/a"));
    const auto identifier = [&] { return bundle->infoDictionary().value_or(Dictionary{})["VBBundleIdentifier"]; };
    EXPECT_EQ(identifier(), Value("a"));

    here.add("A.app", {{"VBBundleIdentifier", "b"}});
    EXPECT_EQ(identifier(), Value("b")) << "the manifest is read anew";
}

TYPED_TEST(BundlesConformance, DirectoryModeOfNoBundleHasThePathAlone) {
    const std::string path = this->world.path("nothing");
    const auto bundle = this->world.bundles.fromPath(path, BundleMode::directory);
    EXPECT_EQ(bundle->property(BundleProperty::path), path);
    EXPECT_FALSE(bundle->property(BundleProperty::supportPath) || bundle->property(BundleProperty::executablePath) ||
                 bundle->infoDictionary());
}

TYPED_TEST(BundlesConformance, ExecutableModeFindsTheBundleAround) {
    auto& here = this->world;
    here.add("A.app", {{"VBBundleExecutable", "bin/a"}}, "bin/a");
    here.add("A.app/PlugIns/P", {{"VBBundleExecutable", "p"}}, "p");
    const auto pathOf = [&](const std::string& name) {
        return here.bundles.fromPath(here.path(name), BundleMode::executable)->property(BundleProperty::path);
    };
    EXPECT_EQ(pathOf("A.app/bin/a"), here.path("A.app"));
    EXPECT_EQ(pathOf("A.app/PlugIns/P/p"), here.path("A.app/PlugIns/P"));
    for (const char* other : {"A.app", "A.app/Info.vlist", "A.app/missing", "A.app/PlugIns/P/Info.vlist"})
        EXPECT_FALSE(pathOf(other)) << other;
}

TEST(BundlesExecutable, MustLieInsideTheBundle) {
    LinuxBundles world;
    const std::string link = world.path("A.app/link");
    support::writeFile(world.path("outside"), "program");
    std::filesystem::create_directories(world.path("A.app/directory"));
    std::filesystem::create_symlink(world.path("outside"), link);
    for (const Value& name : {Value("/bin/sh"), Value("../outside"), Value("link"), Value("missing"), Value("."),
                              Value(""), Value("directory"), Value(7)}) {
        world.add("A.app", {{"VBBundleExecutable", name}});
        const auto bundle = world.bundles.fromPath(world.path("A.app"), BundleMode::directory);
        EXPECT_FALSE(bundle->property(BundleProperty::executablePath)) << name.description();
        EXPECT_FALSE(world.bundles.fromPath(link, BundleMode::executable)->property(BundleProperty::path));
    }
}

TEST(BundlesManifest, UnusableOnesAreNone) {
    LinuxBundles world;
    const std::string manifest = world.path("A.app/Info.vlist");
    const auto read = [&] {
        return world.bundles.fromPath(world.path("A.app"), BundleMode::directory)->infoDictionary();
    };
    platform::Value deepest = "core";
    for (std::size_t i = 0; i < platform::maximumManifestNesting; ++i) deepest = Dictionary{{"key", deepest}};
    support::writeFile(manifest, *platform::encodeXML(deepest));
    EXPECT_TRUE(read());
    for (const Value& unusable : {Value(platform::Array{"no dictionary"}), Value(Dictionary{{"key", deepest}}),
                                  Value(Dictionary{{"big", std::string(1U << 20U, 'x')}})}) {
        support::writeFile(manifest, *platform::encodeXML(unusable));
        EXPECT_FALSE(read()) << unusable.description().substr(0, 60);
    }
    std::filesystem::remove(manifest);
    ASSERT_EQ(mkfifo(manifest.c_str(), 0600), 0);
    EXPECT_FALSE(read()) << "and does not wait for a writer";
}

TEST(BundlesMain, OfAProgramOutsideBundlesIsTheProgram) {
    LinuxBundles world;
    EXPECT_EQ(world.bundles.main()->property(BundleProperty::path),
              std::filesystem::read_symlink("/proc/self/exe").string());
}

} // namespace
