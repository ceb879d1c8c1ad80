#include "platform/linux/TypeConformance.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"
#include "tests/support/TypeConformanceFake.h"

#include <fstream>
#include <gtest/gtest.h>
#include <iterator>
#include <map>
#include <memory>
#include <set>
#include <sys/stat.h>

namespace {

using platform::Array;
using platform::Dictionary;
using Types = std::map<std::string, std::set<std::string>>;

struct LinuxTypes {
    LinuxTypes() { umask(022); } // what a group could write is not believed
    void write(const std::string& name, const std::string& bytes) const { support::writeFile(scratch / name, bytes); }
    void write(const std::string& name, const Dictionary& types, const Dictionary& aliases = {}) const {
        write(name, *platform::encodeXML(Dictionary{{"types", types}, {"aliases", aliases}}));
    }
    void declare(const Types& types) {
        platform::MutableDictionary entries;
        for (const auto& [type, supertypes] : types) entries.set(type, Array::of(supertypes));
        write(system, entries);
        load();
    }
    void load() {
        support::processLog.clear();
        conformance = std::make_unique<platform::linux_::TypeConformance>(platform::linux_::Root(scratch.path()));
    }

    const std::string system = "usr/share/nordane/types.d/Common.vlist";
    support::ScratchDirectory scratch;
    std::unique_ptr<platform::TypeConformance> conformance;
};

struct FakeTypes {
    void declare(const Types& types) const {
        for (const auto& [type, supertypes] : types)
            for (const auto& supertype : supertypes) conformance->declare(type, supertype);
    }
    std::unique_ptr<support::FakeTypeConformance> conformance = std::make_unique<support::FakeTypeConformance>();
};

template <class World> class TypeConformanceConformance : public testing::Test {};
using Worlds = testing::Types<LinuxTypes, FakeTypes>;
TYPED_TEST_SUITE(TypeConformanceConformance, Worlds);

TYPED_TEST(TypeConformanceConformance, FollowsEverySupertypeUpwardsOnly) {
    TypeParam world;
    world.declare({{"svg", {"image", "xml"}},
                   {"image", {"data"}},
                   {"xml", {"text"}},
                   {"text", {"data"}},
                   {"egg", {"hen"}},
                   {"hen", {"egg", "data"}}});
    for (const auto& [type, supertypes] : Types{{"svg", {"svg", "image", "xml", "text", "data"}},
                                                {"hen", {"hen", "egg", "data"}},
                                                {"egg", {"hen", "egg", "data"}},
                                                {"data", {"data"}},
                                                {"SVG", {"SVG"}},
                                                {"unknown", {"unknown"}}}) {
        const auto found = world.conformance->supertypes(type);
        EXPECT_EQ(found.front(), type);
        EXPECT_EQ(std::multiset(found.begin(), found.end()), std::multiset(supertypes.begin(), supertypes.end()));
        for (const char* super : {"svg", "image", "xml", "text", "data", "egg", "hen", "Data", "unknown", ""})
            EXPECT_EQ(world.conformance->conforms(type, super), supertypes.contains(super)) << type << " to " << super;
    }
}

TEST(TypeConformanceOnLinux, FilesAddUpAndDoWithoutTheRefused) {
    LinuxTypes world;
    world.load();
    EXPECT_FALSE(world.conformance->conforms("a", "b"));
    EXPECT_EQ(support::processLog.lines().size(), 1U) << "no types at all";

    const std::string folder = "etc/nordane/types.d";
    world.declare({{"png", {"image"}}});
    world.write(folder + "/1.vlist", {{"png", Array{"texture"}}}, {{"image/png", "png"}});
    world.write(folder + "/2.vlist", "<vlist>");
    world.write(folder + "/3.vlist", {{"unsafe", Array{"other"}}});
    world.write(folder + "/4.vlist", {{"last", Array{"other"}}, {"wrong", 1}});
    chmod((world.scratch / folder + "/3.vlist").c_str(), 0666);
    world.load();
    for (const char* type : {"png", "image/png"})
        for (const char* super : {"png", "image/png", "image", "texture"})
            EXPECT_TRUE(world.conformance->conforms(type, super)) << type << " to " << super;
    EXPECT_TRUE(world.conformance->conforms("last", "other"));
    EXPECT_FALSE(world.conformance->conforms("unsafe", "other"));
    EXPECT_EQ(support::processLog.lines().size(), 3U) << "two files, and the type whose supertypes are no array";
    chmod((world.scratch / folder).c_str(), 0777);
    world.load();
    EXPECT_FALSE(world.conformance->conforms("last", "other"));
}

TEST(TypeConformanceOnLinux, ABoundKeepsDeepTablesInProportion) {
    Types chain;
    for (int number = 0; number < 1500; ++number) chain[std::to_string(number)] = {std::to_string(number + 1)};
    LinuxTypes world;
    world.declare(chain);
    EXPECT_TRUE(world.conformance->conforms("0", "1000"));
    EXPECT_FALSE(world.conformance->conforms("0", "1001"));
    EXPECT_TRUE(world.conformance->conforms("600", "1500"));
    EXPECT_TRUE(support::processLog.contains(platform::LogLevel::error, "", "content type 0: too many supertypes"));
}

TEST(TypeConformanceOnLinux, TheShippedTableIsWhole) {
    std::ifstream file(std::filesystem::path(__FILE__).parent_path() / "../../packaging/types.vlist");
    const std::string bytes{std::istreambuf_iterator<char>(file), {}};
    LinuxTypes world;
    world.write(world.system, bytes);
    world.load();
    const auto types = *platform::decodePropertyList(bytes)->dictionary()->dictionary("types");
    for (const auto& type : types) {
        EXPECT_TRUE(world.conformance->conforms(type.name(), "nordane.type.data") ||
                    world.conformance->conforms(type.name(), "nordane.type.folder"))
            << type.name();
        for (const auto& super : world.conformance->supertypes(type.name()))
            EXPECT_TRUE(types.contains(super) || super.find('/') != std::string::npos) << super;
    }
    EXPECT_TRUE(world.conformance->conforms("image/svg+xml", "nordane.type.text"));
}

} // namespace
