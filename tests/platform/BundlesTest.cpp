#include "platform/linux/Bundles.h"
#include "platform/linux/Files.h"
#include "tests/support/BundleTree.h"
#include "tests/support/BundlesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using enum BundleProperty;

struct BundlesOnDisk : testing::Test {
    support::ScratchDirectory scratch;
    const std::string app = scratch / "A.app";
    linux_::Files files{linux_::Root("/")};
    linux_::Bundles bundles{files};
};

TEST_F(BundlesOnDisk, EachModeFindsWhatIsThereAsInMemory) {
    support::FakeBundles inMemory;
    const auto add = [&](const std::string& path, const Dictionary& manifest, const std::string& program) {
        std::string bytes(compactMagic); // the other encoding is used in the cases for this implementation
        appendCompact(bytes, manifest);
        support::writeFile(path + "/Info.vlist", bytes);
        support::writeFile(path + "/" + program, "program");
        inMemory.add(path, manifest, path + "/" + program);
    };
    for (Bundles* here : std::initializer_list<Bundles*>{&bundles, &inMemory}) {
        add(app, {{"VBBundleIdentifier", "a"}, {"VBBundleExecutable", "bin/a"}}, "bin/a");
        add(app + "/PlugIns/P", {{"VBBundleExecutable", "p"}}, "p");
        const auto around = [&](const char* name) {
            return here->fromPath(app + name, BundleMode::executable)->property(path);
        };
        EXPECT_EQ(around("/bin/a"), app);
        EXPECT_EQ(around("/PlugIns/P/p"), app + "/PlugIns/P");
        for (const char* other : {"", "/Info.vlist", "/missing", "/PlugIns/P/Info.vlist"})
            EXPECT_FALSE(around(other)) << other;
        const auto bundle = here->fromPath(app + "/", BundleMode::directory);
        for (const auto property : {path, supportPath}) EXPECT_EQ(bundle->property(property), app);
        EXPECT_EQ(bundle->property(executablePath), app + "/bin/a");
        EXPECT_EQ(bundle->infoDictionary()->string("VBBundleIdentifier"), "a");
        add(app, {{"VBBundleIdentifier", "b"}}, "bin/a");
        EXPECT_EQ(bundle->infoDictionary()->string("VBBundleIdentifier"), "b") << "the manifest is read anew";
        const auto none = here->fromPath(app + "x", BundleMode::directory);
        EXPECT_EQ(none->property(path), app + "x");
        EXPECT_FALSE(none->property(supportPath) || none->property(executablePath) || none->infoDictionary());
    }
}

} // namespace
