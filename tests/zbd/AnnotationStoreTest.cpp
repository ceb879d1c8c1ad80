#include "tests/support/FakePlatform.h"
#include "zbd/ZBDAnnotationStore.h"
#include "zbd/ZBDPlugIn.h"

#include <gtest/gtest.h>

namespace {

using platform::Dictionary;
using platform::LogLevel;
using platform::Value;
using support::processLog;
using zbd::ZBDAnnotationStore;

constexpr const char* defaultPath = "/var/db/Zembra-Annotations";

std::string xml(const Value& value) { return *platform::encodeXML(value); }

struct AnnotationStore : testing::Test {
    support::FakePlatform fake;

    std::unique_ptr<ZBDAnnotationStore> open(const std::optional<std::string>& path = std::nullopt) {
        return ZBDAnnotationStore::initWithDatabase(fake.platform, path);
    }
    std::shared_ptr<zbd::ZBDPlugIn> plugIn(const std::string& name, std::optional<Dictionary> entitlements = {}) {
        auto described = support::dataPlugIn(name);
        described.entitlements = std::move(entitlements);
        return zbd::ZBDPlugIn::initWithCXData(fake.platform, fake.registry.install(described));
    }
    Dictionary stored(const std::string& path = defaultPath) {
        return *platform::decodePropertyList(fake.files.files.at(path))->dictionary();
    }
    bool logged(LogLevel level, std::string_view start) {
        for (const auto& line : processLog.lines()) {
            if (line.category == "ops" && line.level == level && line.message.starts_with(start)) return true;
        }
        return false;
    }
};

TEST_F(AnnotationStore, LoadsEitherEncodingAndSavesXML) {
    const Dictionary content{{"version", 16}, {"data", Dictionary{{"a", Dictionary{{"election", 2}}}}}};
    std::string compact(platform::compactMagic);
    platform::appendCompact(compact, content);
    for (const std::string& bytes : {xml(content), compact}) {
        fake.files.files[defaultPath] = bytes;
        auto store = open();
        EXPECT_EQ(store->annotationForIdentifier("a"), (Dictionary{{"election", 2}}));
        store->setAnnotation(Dictionary{{"election", 1}}, *plugIn("b"));
        EXPECT_TRUE(fake.files.files[defaultPath].starts_with("<?xml"));
        EXPECT_EQ(stored()["data"], Value(Dictionary{{"a", Dictionary{{"election", 2}}},
                                                     {"com.example.b", Dictionary{{"election", 1}}}}));
    }
}

TEST_F(AnnotationStore, UnloadableFileIsLoggedAndReplacedByTheFirstChange) {
    struct Case {
        std::string bytes;
        std::string text;
    };
    for (const Case& bad : {Case{xml(Dictionary{{"version", 15}, {"data", Dictionary{{"x", Dictionary()}}}}),
                                 "found database version 15 needed version 16"},
                            Case{xml(Dictionary{{"data", Dictionary()}}), "found database version 0 needed version 16"},
                            Case{"no property list", ""}, Case{"", ""}}) {
        processLog.clear();
        fake.files.files[defaultPath] = bad.bytes;
        auto store = open();
        EXPECT_TRUE(logged(LogLevel::error,
                           "unable to load annotation database:file:///var/db/Zembra-Annotations error:" + bad.text));
        EXPECT_TRUE(store->annotations().empty());
        EXPECT_EQ(fake.files.files[defaultPath], bad.bytes) << "nothing is written before a change";
        store->setAnnotation(Dictionary{{"election", 1}}, *plugIn("b"));
        EXPECT_EQ(stored()["version"], Value(16));
        EXPECT_EQ(stored().dictionary("data")->size(), 1U);
    }
}

TEST_F(AnnotationStore, MissingFileIsSilentAndNothingIsWritten) {
    EXPECT_TRUE(open()->annotations().empty());
    EXPECT_TRUE(processLog.messages("ops").empty());
    EXPECT_EQ(fake.files.writes, 0);
}

TEST_F(AnnotationStore, TableThatIsNoDictionaryIsEmpty) {
    fake.files.files[defaultPath] = xml(Dictionary{{"version", 16}, {"data", "text"}});
    EXPECT_TRUE(open()->annotations().empty());
    EXPECT_TRUE(processLog.messages("ops").empty());
}

TEST_F(AnnotationStore, MigratesFromTheContainer) {
    fake.containers.allow("com.nordane.zbd", "/containers/old");
    fake.files.files["/containers/old"] =
        xml(Dictionary{{"version", 16}, {"data", Dictionary{{"a", Dictionary{{"election", 1}}}}}});
    EXPECT_EQ(open()->annotationForIdentifier("a"), (Dictionary{{"election", 1}}));
    EXPECT_TRUE(logged(LogLevel::info, "migrating shared annotations"));
    EXPECT_TRUE(stored().dictionary("data")->contains("a"));

    // A failure to save is told, and the table is used all the same.
    fake.files.files.erase(defaultPath);
    fake.files.writeFailure = platform::Error{platform::fileErrorDomain, platform::fileWriteOutOfSpaceCode, "full"};
    EXPECT_TRUE(open()->annotationForIdentifier("a"));
    EXPECT_TRUE(
        logged(LogLevel::error, "unable to save migrated annotations to file:///var/db/Zembra-Annotations error:full"));
}

TEST_F(AnnotationStore, GivenPathIsTakenAsWritten) {
    fake.files.files["some/where"] = xml(Dictionary{{"version", 16}, {"data", Dictionary{{"a", Dictionary()}}}});
    EXPECT_TRUE(open("some/where")->annotationForIdentifier("a"));
}

TEST_F(AnnotationStore, ContainerFailureEndsTheProcess) {
    fake.containers.failure = 13;
    EXPECT_DEATH((processLog.print(), open()),
                 "failed to get storage container: error=13[^|]*unable to locate user container: error 13");
    fake.files.files[defaultPath] = xml(Dictionary{{"version", 16}});
    EXPECT_TRUE(open()) << "not asked for when the file loads";
}

TEST_F(AnnotationStore, SetMergesAndRemoves) {
    auto store = open();
    const auto first = plugIn("first");
    const auto before = store->annotationForPlugIn(*first);
    EXPECT_FALSE(before);
    store->setAnnotation(Dictionary{{"extension", Dictionary{{"a", 1}}}}, *first);
    const auto extension = *store->annotationForPlugIn(*first);
    store->setAnnotation(Dictionary{{"election", 1}}, *first);
    EXPECT_EQ(store->annotationForPlugIn(*first), (Dictionary{{"extension", Dictionary{{"a", 1}}}, {"election", 1}}));
    EXPECT_FALSE(extension.contains("election")) << "what a reader got does not change under it";
    store->setAnnotation(Dictionary{{"extension", Dictionary{{"b", 2}}}}, *first);
    EXPECT_EQ(store->annotationForPlugIn(*first), (Dictionary{{"extension", Dictionary{{"b", 2}}}, {"election", 1}}));
    store->setAnnotation(std::nullopt, *first);
    EXPECT_FALSE(store->annotationForPlugIn(*first));
    EXPECT_TRUE(stored().dictionary("data")->empty());
}

TEST_F(AnnotationStore, ReplacingPlugInSharesTheAnnotation) {
    auto store = open();
    const auto replacing = plugIn("new", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.old"}});
    const auto old = plugIn("old");
    store->setAnnotation(Dictionary{{"election", 1}}, *replacing);
    EXPECT_EQ(store->annotationForPlugIn(*old), (Dictionary{{"election", 1}}));
    // A value that is no identifier replaces nothing.
    EXPECT_EQ(plugIn("other", Dictionary{{"com.nordane.developer.replace-plugin", true}})->annotationKey(),
              "com.example.other");
}

TEST_F(AnnotationStore, WhatNoFileCanHoldIsNotTaken) {
    auto store = open();
    store->setAnnotation(Dictionary{{"election", 1}}, *plugIn("a"));
    Value deep = 1;
    for (std::size_t i = 0; i < platform::maximumNesting; ++i) deep = platform::Array{deep};
    for (const Value& bad : {Value(platform::UUID::random()), Value("\x01"), deep}) {
        processLog.clear();
        store->setAnnotation(Dictionary{{"extension", Dictionary{{"k", bad}}}}, *plugIn("a"));
        EXPECT_TRUE(logged(LogLevel::error, "unable to save annotations:file:///var/db/Zembra-Annotations error:"));
        EXPECT_EQ(store->annotationForIdentifier("com.example.a"), (Dictionary{{"election", 1}}));
    }
    store->setAnnotation(Dictionary{{"election", 2}}, *plugIn("b"));
    EXPECT_EQ(stored().dictionary("data")->size(), 2U) << "others are saved on";

    // A file that could not be read back is not written.
    const std::string large(ZBDAnnotationStore::maximumFileSize, 'x');
    store->setAnnotation(Dictionary{{"extension", Dictionary{{"k", large}}}}, *plugIn("a"));
    EXPECT_EQ(store->annotationForIdentifier("com.example.a"), (Dictionary{{"election", 1}}));
}

TEST_F(AnnotationStore, UnreadableFileIsReset) {
    fake.files.readFailure =
        platform::Error{platform::fileErrorDomain, platform::fileReadNoPermissionCode, "forbidden"};
    EXPECT_TRUE(open()->annotations().empty());
    EXPECT_TRUE(logged(LogLevel::error, "unable to load annotation database:file:///var/db/Zembra-Annotations "
                                        "error:forbidden (resetting)"));
}

TEST_F(AnnotationStore, UnsavedChangeGoesOutWithTheNext) {
    auto store = open();
    fake.files.writeFailure = platform::Error{platform::fileErrorDomain, platform::fileWriteOutOfSpaceCode, "full"};
    store->setAnnotation(Dictionary{{"election", 1}}, *plugIn("a"));
    EXPECT_TRUE(logged(LogLevel::error, "unable to save annotations:file:///var/db/Zembra-Annotations error:full"));
    EXPECT_TRUE(store->annotationForIdentifier("com.example.a"));
    fake.files.writeFailure.reset();
    store->setAnnotation(Dictionary{{"election", 1}}, *plugIn("b"));
    EXPECT_EQ(stored().dictionary("data")->size(), 2U);
}

} // namespace
