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

struct LinuxBundles {
    /// Adds or replaces a bundle, its executable beside the manifest.
    void add(const std::string& name, const Dictionary& manifest, const std::string& executable = "") {
        std::string bytes(platform::compactMagic); // the other encoding is used in the cases for this implementation
        platform::appendCompact(bytes, manifest);
        support::writeFile(path(name + "/Info.vlist"), bytes);
        if (!executable.empty()) support::writeFile(path(name + "/" + executable), "program");
    }
    std::string path(const std::string& name) const { return scratch / name; }
    auto bundle(const std::string& name) { return bundles.fromPath(path(name), BundleMode::directory); }

    support::ScratchDirectory scratch;
    platform::linux_::Files files{platform::linux_::Root("/")};
    platform::linux_::Bundles bundles{files};
};

struct FakeBundles {
    void add(const std::string& name, const Dictionary& manifest, const std::string& executable = "") {
        const auto program = path(name + "/" + executable);
        bundles.add(path(name), manifest, executable.empty() ? std::nullopt : std::optional(program));
    }
    std::string path(const std::string& name) const { return "/scratch/" + name; }
    auto bundle(const std::string& name) { return bundles.fromPath(path(name), BundleMode::directory); }

    support::FakeBundles bundles;
};

template <class World> class BundlesConformance : public testing::Test {
protected:
    World world;
};
using Worlds = testing::Types<LinuxBundles, FakeBundles>;
TYPED_TEST_SUITE(BundlesConformance, Worlds);

TYPED_TEST(BundlesConformance, DirectoryModeDescribesWhatIsThere) {
    auto& here = this->world;
    here.add("A.app", {{"VBBundleIdentifier", "a"}, {"VBBundleExecutable", "bin/a"}}, "bin/a");
    const auto bundle = here.bundle("A.app/");
    EXPECT_EQ(bundle->property(BundleProperty::path), here.path("A.app"));
    EXPECT_EQ(bundle->property(BundleProperty::supportPath), here.path("A.app"));
    EXPECT_EQ(bundle->property(BundleProperty::executablePath), here.path("A.app/bin/a"));
    for (const char* identifier : {"a", "b"}) {
        here.add("A.app", {{"VBBundleIdentifier", identifier}});
        EXPECT_EQ(bundle->infoDictionary()->string("VBBundleIdentifier"), identifier) << "the manifest is read anew";
    }
    const auto none = here.bundle("nothing");
    EXPECT_EQ(none->property(BundleProperty::path), here.path("nothing"));
    EXPECT_FALSE(none->property(BundleProperty::supportPath) || none->property(BundleProperty::executablePath) ||
                 none->infoDictionary());
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

using BundlesOnLinux = BundlesConformance<LinuxBundles>;

TEST_F(BundlesOnLinux, ExecutablesLieInsideTheBundle) {
    const std::string link = world.path("A.app/link");
    support::writeFile(world.path("outside"), "program");
    std::filesystem::create_directories(world.path("A.app/directory"));
    std::filesystem::create_symlink(world.path("outside"), link);
    for (const Value& name : {Value("/bin/sh"), Value("../outside"), Value("link"), Value("missing"), Value("."),
                              Value(""), Value("directory"), Value(7)}) {
        world.add("A.app", {{"VBBundleExecutable", name}});
        EXPECT_FALSE(world.bundle("A.app")->property(BundleProperty::executablePath)) << name.description();
        EXPECT_FALSE(world.bundles.fromPath(link, BundleMode::executable)->property(BundleProperty::path));
    }
    EXPECT_EQ(world.bundles.main()->property(BundleProperty::path),
              std::filesystem::read_symlink("/proc/self/exe").string())
        << "a program outside bundles";
}

TEST_F(BundlesOnLinux, UnusableManifestsAreNone) {
    const auto read = [&](const Value& manifest) {
        support::writeManifest(world.path("A.app"), manifest);
        return world.bundle("A.app")->infoDictionary();
    };
    Value deepest = "core";
    for (std::size_t i = 0; i < platform::maximumManifestNesting; ++i) deepest = Dictionary{{"key", deepest}};
    EXPECT_TRUE(read(deepest));
    EXPECT_FALSE(read(Dictionary{{"key", deepest}}));
    EXPECT_FALSE(read(platform::Array{"no dictionary"}));
    EXPECT_FALSE(read(Dictionary{{"big", std::string(1U << 20U, 'x')}}));
    const std::string manifest = world.path("A.app/Info.vlist");
    std::filesystem::remove(manifest);
    ASSERT_EQ(mkfifo(manifest.c_str(), 0600), 0);
    EXPECT_FALSE(world.bundle("A.app")->infoDictionary()) << "and does not wait for a writer";
}

} // namespace
