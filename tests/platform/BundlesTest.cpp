#include "platform/linux/Bundles.h"
#include "platform/linux/Files.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using platform::BundleMode;
using platform::BundleProperty;
using platform::Dictionary;
using platform::Value;

void writeFile(const std::string& path, const std::string& bytes) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path, std::ios::binary) << bytes;
}

/// Bundles on disk.
class LinuxBundles {
public:
    void add(const std::string& name, const Dictionary& manifest, const std::string& executable = "") {
        std::filesystem::create_directories(_scratch / name);
        std::string bytes(platform::compactMagic); // the other encoding is used in the cases for this implementation
        platform::appendCompact(bytes, manifest);
        writeFile(_scratch / name + "/Info.vlist", bytes);
        if (!executable.empty()) writeFile(_scratch / name + "/" + executable, "program");
    }
    std::string path(const std::string& name) const { return _scratch / name; }
    platform::Bundles& bundles() { return _bundles; }

private:
    support::ScratchDirectory _scratch;
    platform::linux_::Files _files{platform::linux_::Root("/")};
    platform::linux_::Bundles _bundles{_files};
};

class FakeBundles {
public:
    void add(const std::string& name, const Dictionary& manifest, const std::string& executable = "") {
        _bundles.add(path(name), manifest,
                     executable.empty() ? std::nullopt : std::optional(path(name + "/" + executable)));
    }
    std::string path(const std::string& name) const { return "/scratch/" + name; }
    platform::Bundles& bundles() { return _bundles; }

private:
    support::FakeBundles _bundles;
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
    const auto bundle = here.bundles().fromPath(here.path("A.app") + "/", BundleMode::directory);
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
    const auto bundle = this->world.bundles().fromPath(path, BundleMode::directory);
    EXPECT_EQ(bundle->property(BundleProperty::path), path);
    EXPECT_FALSE(bundle->property(BundleProperty::supportPath));
    EXPECT_FALSE(bundle->property(BundleProperty::executablePath));
    EXPECT_FALSE(bundle->infoDictionary());
}

TYPED_TEST(BundlesConformance, ExecutableModeFindsTheBundleAround) {
    auto& here = this->world;
    here.add("A.app", {{"VBBundleExecutable", "bin/a"}}, "bin/a");
    here.add("A.app/PlugIns/P", {{"VBBundleExecutable", "p"}}, "p");
    const auto pathOf = [&](const std::string& name) {
        return here.bundles().fromPath(here.path(name), BundleMode::executable)->property(BundleProperty::path);
    };
    EXPECT_EQ(pathOf("A.app/bin/a"), here.path("A.app"));
    EXPECT_EQ(pathOf("A.app/PlugIns/P/p"), here.path("A.app/PlugIns/P"));
    for (const char* other : {"A.app", "A.app/Info.vlist", "A.app/missing", "A.app/PlugIns/P/Info.vlist"}) {
        EXPECT_FALSE(pathOf(other)) << other;
    }
}

TEST(BundlesExecutable, MustLieInsideTheBundle) {
    LinuxBundles world;
    writeFile(world.path("outside"), "program");
    for (const Value& name : {Value("/bin/sh"), Value("../outside"), Value("link"), Value("missing"), Value("."),
                              Value(""), Value("directory"), Value(7)}) {
        world.add("A.app", {{"VBBundleExecutable", name}});
        std::filesystem::create_directory(world.path("A.app/directory"));
        std::error_code exists;
        std::filesystem::create_symlink(world.path("outside"), world.path("A.app/link"), exists);
        const auto bundle = world.bundles().fromPath(world.path("A.app"), BundleMode::directory);
        EXPECT_FALSE(bundle->property(BundleProperty::executablePath)) << name.description();
    }
    EXPECT_FALSE(
        world.bundles().fromPath(world.path("A.app/link"), BundleMode::executable)->property(BundleProperty::path));
}

TEST(BundlesManifest, UnusableOnesAreNone) {
    LinuxBundles world;
    const std::string manifest = world.path("A.app/Info.vlist");
    const auto read = [&] {
        return world.bundles().fromPath(world.path("A.app"), BundleMode::directory)->infoDictionary();
    };
    platform::Value deepest = "core";
    for (std::size_t i = 0; i < platform::maximumManifestNesting; ++i) deepest = Dictionary{{"key", deepest}};
    writeFile(manifest, *platform::encodeXML(deepest));
    EXPECT_TRUE(read());

    const std::string head = "<?xml version=\"1.0\"?>\n";
    for (const std::string& bytes : {std::string(), *platform::encodeXML(platform::Array{"no dictionary"}),
                                     *platform::encodeXML(Dictionary{{"key", deepest}}),
                                     *platform::encodeXML(Dictionary{{"big", std::string(1U << 20U, 'x')}}),
                                     head + "<!DOCTYPE v [<!ENTITY a \"b\">]><vlist><dict/></vlist>"}) {
        writeFile(manifest, bytes);
        EXPECT_FALSE(read()) << bytes.substr(0, 60);
    }
    std::filesystem::remove(manifest);
    ASSERT_EQ(mkfifo(manifest.c_str(), 0600), 0);
    EXPECT_FALSE(read()) << "and does not wait for a writer";
}

TEST(BundlesMain, OfAProgramOutsideBundlesIsTheProgram) {
    LinuxBundles world;
    EXPECT_EQ(world.bundles().main()->property(BundleProperty::path),
              std::filesystem::read_symlink("/proc/self/exe").string());
}

} // namespace
