#include "tests/support/FakePlatform.h"
#include "zbd/ZBDAnnotationStore.h"
#include "zbd/ZBDPlugIn.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using zbd::ZBDAnnotationStore;

constexpr const char* path = "/var/db/Zembra-Annotations";
const std::string unsaved = "unable to save annotations:file:///var/db/Zembra-Annotations error:";
const Dictionary elected{{"election", 1}};
using Files = std::map<std::string, std::string>;
const Error full{fileErrorDomain, fileWriteOutOfSpaceCode, "full"};

Dictionary extension(const Value& value) { return {{"extension", Dictionary{{"k", value}}}}; }

struct AnnotationStore : testing::Test {
    support::FakePlatform fake;
    Files& files = fake.files.files;

    std::unique_ptr<ZBDAnnotationStore> open() {
        return ZBDAnnotationStore::initWithDatabase(fake.platform, std::nullopt);
    }
    std::shared_ptr<zbd::ZBDPlugIn> plugIn(const std::string& name, std::optional<Dictionary> entitlements = {}) {
        return zbd::ZBDPlugIn::initWithCXData(fake.platform, fake.install(name, std::move(entitlements)));
    }
    Dictionary stored() { return *decodePropertyList(files.at(path))->dictionary()->dictionary("data"); }
};

TEST_F(AnnotationStore, UnloadableFileIsSetAsideByTheFirstChange) {
    files[path] = "anything";
    fake.files.readFailure = Error{fileErrorDomain, fileReadNoPermissionCode, "forbidden"};
    auto store = open();
    fake.files.readFailure.reset();
    EXPECT_TRUE(logged(LogLevel::error, "unable to load annotation database:file:///var/db/Zembra-Annotations "
                                        "error:forbidden (resetting)"));
    fake.files.setAsideFailure = full;
    store->setAnnotation(elected, *plugIn("a"));
    EXPECT_TRUE(logged(LogLevel::error, unsaved + "full"));
    EXPECT_EQ(files, (Files{{path, "anything"}})) << "what cannot be kept is not replaced";
    fake.files.setAsideFailure.reset();
    for (const char* name : {"b", "c"}) store->setAnnotation(elected, *plugIn(name));
    EXPECT_EQ(files["/var/db/Zembra-Annotations.damaged"], "anything") << "set aside once";
    EXPECT_EQ(stored().size(), 3U) << "an unsaved change goes out with the next";
}

TEST_F(AnnotationStore, MigratesFromTheContainerInEitherEncoding) {
    fake.containers.allow("com.nordane.zbd", "/containers/old");
    const Dictionary old{{"version", 16}, {"data", Dictionary{{"a", elected}}}};
    std::string compact(compactMagic);
    appendCompact(compact, old);
    for (const std::string& encoded : {*encodeXML(old), compact}) {
        files = {{"/containers/old", encoded}, {path, "nonsense"}};
        open();
        EXPECT_TRUE(logged(LogLevel::info, "migrating shared annotations"));
        EXPECT_EQ(files[path], *encodeXML(old));
    }
    files.erase(path);
    fake.files.writeFailure = full;
    EXPECT_EQ(open()->annotationForIdentifier("a"), elected) << "used all the same";
}

TEST_F(AnnotationStore, SetMergesAndRemoves) {
    const auto store = open();
    const auto first = plugIn("first");
    const auto twin = plugIn("twin", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.first"}});
    store->setAnnotation(extension(1), *first);
    store->setAnnotation(elected, *twin);
    store->setAnnotation(extension("new"), *first);
    EXPECT_EQ(store->annotationForPlugIn(*twin),
              (Dictionary{{"extension", Dictionary{{"k", "new"}}}, {"election", 1}}));
    store->setAnnotation(std::nullopt, *first);
    EXPECT_TRUE(stored().empty());
}

TEST_F(AnnotationStore, WhatNoFileCanHoldIsNotTaken) {
    const auto store = open();
    const auto a = plugIn("a"), b = plugIn("b"), c = plugIn("c");
    const auto set = [&](const std::vector<zbd::AnnotationChange>& changes) { store->setAnnotations(changes); };
    Value deep = 1;
    for (std::size_t i = 0; i < maximumNesting; ++i) deep = Array{deep};
    const std::string large(ZBDAnnotationStore::maximumFileSize, 'x'); // no file could be read back
    for (const Value& bad : {Value(UUID::random()), Value("\x01"), deep, Value(large)}) {
        support::processLog.clear();
        set({{std::nullopt, b}, {extension(bad), a}, {elected, b}});
        EXPECT_TRUE(logged(LogLevel::error, unsaved));
        EXPECT_EQ(stored(), (Dictionary{{"com.example.b", elected}})) << "it alone is refused";
    }
    // Nor what is too much together.
    const auto half = extension(large.substr(large.size() / 2));
    set({{half, a}});
    set({{elected, c}, {half, b}});
    EXPECT_FALSE(store->annotationForPlugIn(*c));
    EXPECT_EQ(store->annotationForPlugIn(*b), elected);
    set({{elected, c}});
    EXPECT_EQ(stored().size(), 3U) << "others are saved on";
}

} // namespace
