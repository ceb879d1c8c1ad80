#include "platform/linux/TypeConformance.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"
#include "tests/support/TypeConformanceFake.h"

#include <gtest/gtest.h>
#include <map>
#include <sys/stat.h>

namespace {

using namespace platform;
using support::processLog;
using Types = std::map<std::string, std::set<std::string>>;

struct TypesOnDisk : testing::Test {
    TypesOnDisk() { umask(022); } // what a group could write is not believed
    void write(const std::string& name, const Dictionary& types, const Dictionary& aliases = {}) const {
        support::writeFile(scratch / name, *encodeXML(Dictionary{{"types", types}, {"aliases", aliases}}));
    }
    linux_::TypeConformance load() const {
        processLog.clear();
        return linux_::TypeConformance(linux_::Root(scratch.path()));
    }
    const std::string common = "usr/share/nordane/types.d/Common.vlist";
    support::ScratchDirectory scratch;
};

TEST_F(TypesOnDisk, FollowEverySupertypeUpwardsOnlyAsThoseInMemoryDo) {
    MutableDictionary entries;
    support::FakeTypeConformance inMemory;
    for (const auto& [type, supertypes] : Types{{"svg", {"image", "xml"}},
                                                {"image", {"data"}},
                                                {"xml", {"text"}},
                                                {"text", {"data"}},
                                                {"egg", {"hen"}},
                                                {"hen", {"egg", "data"}}}) {
        entries.set(type, Array::of(supertypes));
        for (const auto& supertype : supertypes) inMemory.declare(type, supertype);
    }
    write(common, entries);
    auto onDisk = load();
    for (const auto& [type, supertypes] : Types{{"svg", {"svg", "image", "xml", "text", "data"}},
                                                {"hen", {"hen", "egg", "data"}},
                                                {"data", {"data"}},
                                                {"SVG", {"SVG"}}}) {
        for (TypeConformance* conformance : std::initializer_list<TypeConformance*>{&onDisk, &inMemory}) {
            const auto found = conformance->supertypes(type);
            EXPECT_EQ(found.front(), type);
            EXPECT_EQ(std::multiset(found.begin(), found.end()), std::multiset(supertypes.begin(), supertypes.end()));
            for (const char* super : {"svg", "image", "xml", "text", "data", "egg", "hen", "Data", "SVG", ""})
                EXPECT_EQ(conformance->conforms(type, super), supertypes.contains(super)) << type << " to " << super;
        }
    }
}

} // namespace
