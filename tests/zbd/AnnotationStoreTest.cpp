#include "tests/support/FakePlatform.h"
#include "zbd/ZBDAnnotationStore.h"
#include "zbd/ZBDPlugIn.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using zbd::ZBDAnnotationStore;

constexpr const char* path = "/var/db/Zembra-Annotations";
constexpr const char* damaged = "/var/db/Zembra-Annotations.damaged";
const std::string unsaved = "unable to save annotations:file:///var/db/Zembra-Annotations error:";
const Dictionary elected{{"election", 1}};
const Error full{fileErrorDomain, fileWriteOutOfSpaceCode, "full"};

Dictionary database(const Value& data) { return {{"version", 16}, {"data", data}}; }
std::string xml(const Value& value) { return *encodeXML(value); }

struct AnnotationStore : testing::Test {
    support::FakePlatform fake;
    std::map<std::string, std::string>& files = fake.files.files;

    std::unique_ptr<ZBDAnnotationStore> open(const std::optional<std::string>& given = std::nullopt) {
        support::processLog.clear();
        return ZBDAnnotationStore::initWithDatabase(fake.platform, given);
    }
    std::shared_ptr<zbd::ZBDPlugIn> plugIn(const std::string& name, std::optional<Dictionary> entitlements = {}) {
        auto described = support::dataPlugIn(name);
        described.entitlements = std::move(entitlements);
        return zbd::ZBDPlugIn::initWithCXData(fake.platform, fake.registry.install(described));
    }
    Dictionary stored() { return *decodePropertyList(files.at(path))->dictionary()->dictionary("data"); }
};

TEST_F(AnnotationStore, LoadsEitherEncodingAndSavesXML) {
    const Dictionary content = database(Dictionary{{"a", Dictionary{{"election", 2}}}});
    std::string compact(compactMagic);
    appendCompact(compact, content);
    for (const std::string& bytes : {xml(content), compact}) {
        files[path] = bytes;
        const auto store = open();
        EXPECT_EQ(store->annotationForIdentifier("a"), (Dictionary{{"election", 2}}));
        store->setAnnotation(elected, *plugIn("b"));
        EXPECT_TRUE(files[path].starts_with("<?xml"));
        EXPECT_EQ(stored(), (Dictionary{{"a", Dictionary{{"election", 2}}}, {"com.example.b", elected}}));
    }
    EXPECT_FALSE(files.contains(damaged));
    files["some/where"] = xml(content);
    EXPECT_TRUE(open("some/where")->annotationForIdentifier("a")) << "a given path is taken as written";
}

TEST_F(AnnotationStore, UnloadableFileIsSetAsideByTheFirstChange) {
    const struct {
        std::string bytes;
        std::string text;
        Failure readFailure = std::nullopt;
    } cases[] = {
        {xml(Dictionary{{"version", 15}, {"data", Dictionary()}}), "found database version 15 needed version 16"},
        {xml(Dictionary{{"data", Dictionary()}}), "found database version 0 needed version 16"},
        {"no property list", ""},
        {"", ""},
        {"anything", "forbidden (resetting)", Error{fileErrorDomain, fileReadNoPermissionCode, "forbidden"}},
    };
    for (const auto& bad : cases) {
        files = {{path, bad.bytes}};
        fake.files.readFailure = bad.readFailure;
        const auto store = open();
        fake.files.readFailure.reset();
        EXPECT_TRUE(logged(LogLevel::error,
                           "unable to load annotation database:file:///var/db/Zembra-Annotations error:" + bad.text));
        EXPECT_TRUE(store->annotations().empty());
        EXPECT_EQ(files, (std::map<std::string, std::string>{{path, bad.bytes}})) << "a change is awaited";

        fake.files.setAsideFailure = full;
        store->setAnnotation(elected, *plugIn("a"));
        EXPECT_TRUE(logged(LogLevel::error, unsaved + "full"));
        EXPECT_EQ(files[path], bad.bytes) << "what cannot be kept is not replaced";
        fake.files.setAsideFailure.reset();
        for (const char* name : {"b", "c"}) store->setAnnotation(elected, *plugIn(name));
        EXPECT_EQ(files[damaged], bad.bytes) << "set aside once";
        EXPECT_EQ(stored().size(), 3U);
    }
    files = {{path, "nonsense"}};
    const auto store = open();
    files.clear();
    store->setAnnotation(elected, *plugIn("a"));
    EXPECT_EQ(stored().size(), 1U) << "somebody else has taken it away";
}

TEST_F(AnnotationStore, WithoutATableItIsSilentAndEmpty) {
    for (const bool hasFile : {false, true}) {
        if (hasFile) files[path] = xml(database("text"));
        EXPECT_TRUE(open()->annotations().empty());
        EXPECT_TRUE(support::processLog.messages("ops").empty());
        EXPECT_EQ(fake.files.writes, 0);
    }
}

TEST_F(AnnotationStore, MigratesFromTheContainer) {
    fake.containers.allow("com.nordane.zbd", "/containers/old");
    files = {{"/containers/old", xml(database(Dictionary{{"a", elected}}))}, {path, "nonsense"}};
    EXPECT_EQ(open()->annotationForIdentifier("a"), elected);
    EXPECT_TRUE(logged(LogLevel::info, "migrating shared annotations"));
    EXPECT_TRUE(stored().contains("a"));
    EXPECT_EQ(files[damaged], "nonsense");

    files.erase(path);
    fake.files.writeFailure = full;
    EXPECT_TRUE(open()->annotationForIdentifier("a")) << "used all the same";
    EXPECT_TRUE(
        logged(LogLevel::error, "unable to save migrated annotations to file://" + std::string(path) + " error:full"));

    fake.containers.failure = 13;
    EXPECT_FALSE(open());
    EXPECT_TRUE(logged(LogLevel::error, "failed to get storage container: error=13"));
    EXPECT_TRUE(logged(LogLevel::error, "unable to locate user container: error 13"));
    files[path] = xml(database(Dictionary()));
    EXPECT_TRUE(open()) << "not asked for when the file loads";
}

TEST_F(AnnotationStore, SetMergesAndRemoves) {
    const auto store = open();
    const auto first = plugIn("first");
    EXPECT_FALSE(store->annotationForPlugIn(*first));
    store->setAnnotation(Dictionary{{"extension", Dictionary{{"a", 1}}}}, *first);
    const auto before = *store->annotationForPlugIn(*first);
    store->setAnnotation(elected, *first);
    EXPECT_EQ(store->annotationForPlugIn(*first), (Dictionary{{"extension", Dictionary{{"a", 1}}}, {"election", 1}}));
    EXPECT_FALSE(before.contains("election")) << "what a reader got does not change under it";
    store->setAnnotation(Dictionary{{"extension", Dictionary{{"b", 2}}}}, *first);
    EXPECT_EQ(store->annotationForPlugIn(*first), (Dictionary{{"extension", Dictionary{{"b", 2}}}, {"election", 1}}));
    store->setAnnotation(std::nullopt, *first);
    EXPECT_FALSE(store->annotationForPlugIn(*first));
    EXPECT_TRUE(stored().empty());
}

TEST_F(AnnotationStore, ReplacingPlugInSharesTheAnnotation) {
    const auto store = open();
    const auto replacing = plugIn("new", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.old"}});
    store->setAnnotation(elected, *replacing);
    EXPECT_EQ(store->annotationForPlugIn(*plugIn("old")), elected);
    // A value that is no identifier replaces nothing.
    EXPECT_EQ(plugIn("other", Dictionary{{"com.nordane.developer.replace-plugin", true}})->annotationKey(),
              "com.example.other");
}

TEST_F(AnnotationStore, WhatNoFileCanHoldIsNotTaken) {
    const auto store = open();
    store->setAnnotation(elected, *plugIn("a"));
    Value deep = 1;
    for (std::size_t i = 0; i < maximumNesting; ++i) deep = Array{deep};
    const Value large = std::string(ZBDAnnotationStore::maximumFileSize, 'x'); // no file could be read back
    for (const Value& bad : {Value(UUID::random()), Value("\x01"), deep, large}) {
        support::processLog.clear();
        store->setAnnotation(Dictionary{{"extension", Dictionary{{"k", bad}}}}, *plugIn("a"));
        EXPECT_TRUE(logged(LogLevel::error, unsaved));
        EXPECT_EQ(store->annotationForIdentifier("com.example.a"), elected);
        if (bad == large) continue;
        const std::vector<zbd::AnnotationChange> together{
            {Dictionary{{"extension", Dictionary{{"k", bad}}}}, plugIn("bad")}, {elected, plugIn("good")}};
        store->setAnnotations(together);
        EXPECT_EQ(stored()["com.example.good"], Value(elected));
        store->setAnnotation(std::nullopt, *plugIn("good"));
    }
    // Nor what is too much together.
    const Dictionary half{{"extension", Dictionary{{"k", std::string(ZBDAnnotationStore::maximumFileSize / 2, 'x')}}}};
    const std::vector<zbd::AnnotationChange> changes{{half, plugIn("b")}, {elected, plugIn("c")}};
    store->setAnnotations(changes);
    EXPECT_EQ(stored().size(), 3U);
    const std::vector<zbd::AnnotationChange> tooMuch{{elected, plugIn("d")}, {half, plugIn("e")}};
    store->setAnnotations(tooMuch);
    EXPECT_FALSE(store->annotationForIdentifier("com.example.d"));
    EXPECT_FALSE(store->annotationForIdentifier("com.example.e"));
    store->setAnnotation(elected, *plugIn("f"));
    EXPECT_EQ(stored().size(), 4U) << "others are saved on";
}

TEST_F(AnnotationStore, UnsavedChangeGoesOutWithTheNext) {
    const auto store = open();
    fake.files.writeFailure = full;
    store->setAnnotation(elected, *plugIn("a"));
    EXPECT_TRUE(logged(LogLevel::error, unsaved + "full"));
    EXPECT_TRUE(store->annotationForIdentifier("com.example.a"));
    fake.files.writeFailure.reset();
    store->setAnnotation(elected, *plugIn("b"));
    EXPECT_EQ(stored().size(), 2U);
}

} // namespace
